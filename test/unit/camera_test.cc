// Camera capture: media types, the preview callbacks' logic, the manager's record rules and
// event handling against a fake engine, and the camera source over a lavfi test device.
#include <gtest/gtest.h>

#include <chrono>
#include <cstdio>
#include <cstring>
#include <filesystem>
#include <string>
#include <thread>
#include <vector>

#include "capture/video/camera/mfce/capturemanager.h"
#include "capture/video/camera/mfce/mediatypes.h"
#include "capture/video/camera/mfce/mfcesource.h"
#include "capture/video/camera/mfce/previewcallbacks.h"
#include "fakes/captureengine.h"
#include "platform/linux/mf/mfattributes.h"
#include "support.h"

namespace mfce = capture::video::camera::mfce;

namespace {

ComPtr<IMFMediaType> videoType(const GUID& subtype, UINT32 width, UINT32 height, UINT32 num, UINT32 den) {
  ComPtr<IMFMediaType> type;
  EXPECT_EQ(S_OK, MFCreateMediaType(&type));
  type->SetGUID(MF_MT_MAJOR_TYPE, MFMediaType_Video);
  type->SetGUID(MF_MT_SUBTYPE, subtype);
  MFSetAttributeSize(type.Get(), MF_MT_FRAME_SIZE, width, height);
  MFSetAttributeRatio(type.Get(), MF_MT_FRAME_RATE, num, den);
  MFSetAttributeRatio(type.Get(), MF_MT_PIXEL_ASPECT_RATIO, 1, 1);
  type->SetUINT32(MF_MT_INTERLACE_MODE, MFVideoInterlace_Progressive);
  return type;
}

GUID subtypeOf(IMFMediaType* type) {
  GUID subtype = GUID_NULL;
  type->GetGUID(MF_MT_SUBTYPE, &subtype);
  return subtype;
}

// A number of a media type; 0 when it has none.
UINT32 numberOf(IMFMediaType* type, const GUID& key) {
  UINT32 value = 0;
  type->GetUINT32(key, &value);
  return value;
}

class FakeEvent : public platform::Attributes<IMFMediaEvent, IID_IMFMediaEvent> {
 public:
  FakeEvent(const GUID& type, HRESULT status, bool typeReadable = true)
      : type_(type), status_(status), typeReadable_(typeReadable) {}
  HRESULT GetExtendedType(GUID* type) override {
    if (!typeReadable_) return E_FAIL;
    *type = type_;
    return S_OK;
  }
  HRESULT GetStatus(HRESULT* status) override {
    *status = status_;
    return S_OK;
  }
  HRESULT GetValue(PROPVARIANT* value) override {
    PropVariantInit(value);
    return S_OK;
  }

 private:
  GUID type_;
  HRESULT status_;
  bool typeReadable_;
};

bool signalled(HANDLE event) { return WaitForSingleObject(event, 0) == WAIT_OBJECT_0; }

// The manager's one auto-reset event keeps a signal of an earlier event pending, so a wait may end
// before the event it waits for has come: poll the flag the event sets.
using testsupport::eventually;

}  // namespace

TEST(CameraMediaTypes, EstimateBitrateInSinglePrecision) {
  // Whole rates are checked through the record stream's bit rate; this one needs the denominator.
  EXPECT_EQ(9206793u, mfce::EstimateBitrate(1280, 720, 30000, 1001));
  EXPECT_EQ(41430568u, mfce::EstimateBitrate(1920, 1080, 60000, 1001));  // 41430569 in double precision
  ComPtr<IMFMediaType> type = videoType(MFVideoFormat_MJPG, 1280, 720, 30000, 1001);
  EXPECT_EQ(9206793u, mfce::EstimateBitrate(type.Get()));
}

TEST(CameraMediaTypes, MakeVideoTypeCopiesGeometryAndNeedsEveryItem) {
  ComPtr<IMFMediaType> source = videoType(MFVideoFormat_YUY2, 640, 480, 30, 1);
  IMFMediaType* made = nullptr;
  ASSERT_EQ(S_OK, mfce::MakeVideoType(source.Get(), MFVideoFormat_ARGB32, &made));
  EXPECT_EQ(MFVideoFormat_ARGB32, subtypeOf(made));
  UINT64 size = 0;
  made->GetUINT64(MF_MT_FRAME_SIZE, &size);
  EXPECT_EQ((UINT64{640} << 32) | 480, size);
  made->Release();

  source->DeleteItem(MF_MT_INTERLACE_MODE);
  made = nullptr;
  EXPECT_EQ(MF_E_ATTRIBUTENOTFOUND, mfce::MakeVideoType(source.Get(), MFVideoFormat_H264, &made));
  EXPECT_EQ(nullptr, made);
}

TEST(CameraMediaTypes, MakePcmType) {
  IMFMediaType* pcm = nullptr;
  MFCreateMediaType(&pcm);
  pcm->SetGUID(MF_MT_MAJOR_TYPE, MFMediaType_Audio);
  pcm->SetGUID(MF_MT_SUBTYPE, MFAudioFormat_PCM);
  IMFMediaType* same = nullptr;
  ASSERT_EQ(S_OK, mfce::MakePcmType(pcm, &same));
  EXPECT_EQ(pcm, same);  // already PCM: the same object, one more reference
  same->Release();
  pcm->Release();

  IMFMediaType* floats = nullptr;
  MFCreateMediaType(&floats);
  floats->SetGUID(MF_MT_MAJOR_TYPE, MFMediaType_Audio);
  floats->SetGUID(MF_MT_SUBTYPE, MFAudioFormat_Float);
  floats->SetUINT32(MF_MT_AUDIO_NUM_CHANNELS, 2);
  floats->SetUINT32(MF_MT_AUDIO_SAMPLES_PER_SECOND, 48000);
  IMFMediaType* made = nullptr;
  ASSERT_EQ(S_OK, mfce::MakePcmType(floats, &made));  // no bit count: 16
  EXPECT_EQ(MFAudioFormat_PCM, subtypeOf(made));
  EXPECT_EQ(16u, numberOf(made, MF_MT_AUDIO_BITS_PER_SAMPLE));
  EXPECT_EQ(4u, numberOf(made, MF_MT_AUDIO_BLOCK_ALIGNMENT));
  EXPECT_EQ(192000u, numberOf(made, MF_MT_AUDIO_AVG_BYTES_PER_SECOND));
  EXPECT_EQ(1u, numberOf(made, MF_MT_ALL_SAMPLES_INDEPENDENT));
  made->Release();

  floats->SetUINT32(MF_MT_AUDIO_BITS_PER_SAMPLE, 24);
  floats->SetUINT32(MF_MT_AUDIO_NUM_CHANNELS, 3);
  ASSERT_EQ(S_OK, mfce::MakePcmType(floats, &made));
  EXPECT_EQ(9u, numberOf(made, MF_MT_AUDIO_BLOCK_ALIGNMENT));
  made->Release();

  floats->DeleteItem(MF_MT_AUDIO_NUM_CHANNELS);
  made = nullptr;
  EXPECT_EQ(MF_E_INVALIDTYPE, mfce::MakePcmType(floats, &made));
  floats->SetGUID(MF_MT_MAJOR_TYPE, MFMediaType_Video);
  EXPECT_EQ(MF_E_INVALIDMEDIATYPE, mfce::MakePcmType(floats, &made));
  EXPECT_EQ(nullptr, made);
  floats->Release();
}

TEST(CameraPreviewCallbacks, PeakScan) {
  const int16_t mono[] = {1000, -2000};
  mfce::Peaks peaks = mfce::scanPeaks(reinterpret_cast<const uint8_t*>(mono), sizeof(mono), 1, 16);
  EXPECT_DOUBLE_EQ(2000 / 32767.0, peaks.left);
  EXPECT_DOUBLE_EQ(2000 / 32767.0, peaks.right);

  // Only the first half of a stereo buffer's frames counts.
  const int16_t stereo[] = {100, -200, 300, 0, 30000, 30000, -32768, 5};
  peaks = mfce::scanPeaks(reinterpret_cast<const uint8_t*>(stereo), sizeof(stereo), 2, 16);
  EXPECT_DOUBLE_EQ(300 / 32767.0, peaks.left);
  EXPECT_DOUBLE_EQ(200 / 32767.0, peaks.right);

  const int16_t loud[] = {-32768};
  EXPECT_GT(mfce::scanPeaks(reinterpret_cast<const uint8_t*>(loud), sizeof(loud), 1, 16).left, 1.0);

  const int32_t wide[] = {-1073741824, 2147483647};
  peaks = mfce::scanPeaks(reinterpret_cast<const uint8_t*>(wide), sizeof(wide), 1, 32);
  EXPECT_DOUBLE_EQ(1.0, peaks.left);

  const uint8_t packed[] = {0xFF, 0xFF, 0x7F, 0x00, 0x00, 0x80};
  peaks = mfce::scanPeaks(packed, sizeof(packed), 2, 24);
  EXPECT_EQ(0.0, peaks.left);
  EXPECT_EQ(0.0, peaks.right);
}

TEST(CameraPreviewCallbacks, VideoSampleReplacesTheQueue) {
  capture::video::FrameQueue queue(L"", 2, 1, 1);
  const uint8_t first[8] = {1, 2, 3, 4, 5, 6, 7, 8};
  const uint8_t second[8] = {9, 9, 9, 9, 8, 8, 8, 8};
  mfce::replaceFrame(queue, first, 100);
  const uint8_t* firstPixels = queue.frames.back()->data.get();
  mfce::replaceFrame(queue, second, 200);
  ASSERT_EQ(1u, queue.frames.size());
  const capture::video::Frame& frame = *queue.frames.back();
  EXPECT_EQ(200, frame.timestamp);
  EXPECT_EQ(8u, frame.size);
  EXPECT_EQ(1u, frame.channelOrder);
  EXPECT_EQ(2u, frame.rowPixels);
  EXPECT_EQ(0, std::memcmp(second, frame.data.get(), 8));
  // The replaced picture's memory is written into next, not a new block.
  mfce::replaceFrame(queue, first, 300);
  EXPECT_EQ(firstPixels, queue.frames.back()->data.get());
  EXPECT_EQ(0, std::memcmp(first, firstPixels, 8));
  EXPECT_EQ(300, queue.frames.back()->timestamp);
}

// A fake engine held by `manager`. An answering one answers each command at once, as its event
// handled by the manager, which then needs the event it signals.
fakes::FakeCaptureEngine* fakeEngine(mfce::CaptureManager& manager, bool answering = false) {
  auto* engine = new fakes::FakeCaptureEngine;
  manager.engine.Attach(engine);
  if (answering) {
    manager.engineEvent = CreateEventA(nullptr, FALSE, FALSE, nullptr);
    engine->answer = [&manager](const GUID& type, HRESULT status) {
      manager.HandleEngineEvent(new FakeEvent(type, status));
    };
  }
  return engine;
}

TEST(CameraCaptureManager, RecordsOnlyToDotMp4SpeltExactly) {
  mfce::CaptureManager manager;
  auto* engine = fakeEngine(manager);
  manager.hasVideo = 1;
  engine->AddRef();
  for (const wchar_t* path : {L"/tmp/clip.MP4", L"/tmp/clip.mp4x", L"/tmp/clip", L"/tmp/a.mp4/clip"})
    EXPECT_EQ(MF_E_INVALIDMEDIATYPE, manager.StartRecord(path)) << platform::narrow(path);
  EXPECT_EQ(0, engine->getSinkCalls);
  EXPECT_EQ(MF_E_NOT_INITIALIZED, mfce::CaptureManager().StartRecord(L"x.mp4"));
  manager.recording = true;
  EXPECT_EQ(MF_E_INVALIDREQUEST, manager.StartRecord(L"x.mp4"));
  manager.recording = false;
  manager.engine = nullptr;
  engine->Release();
}

TEST(CameraCaptureManager, VideoRecordStreamAsksForH264) {
  mfce::CaptureManager manager;
  auto* engine = fakeEngine(manager, true);
  manager.hasVideo = 1;
  ComPtr<IMFMediaType> mjpg = videoType(MFVideoFormat_MJPG, 640, 480, 30, 1);
  engine->source->videoType = mjpg.Get();
  ASSERT_EQ(S_OK, manager.StartRecord(L"/tmp/clip.mp4"));
  EXPECT_EQ(L"/tmp/clip.mp4", engine->sink->fileName);
  EXPECT_EQ(1, engine->sink->removeAllCalls);
  EXPECT_EQ(1, engine->startRecordCalls);
  ASSERT_EQ(1u, engine->sink->added.size());  // video only: no audio stream is asked for
  EXPECT_EQ(DWORD{MF_CAPTURE_ENGINE_PREFERRED_SOURCE_STREAM_FOR_VIDEO_RECORD}, engine->sink->sources[0]);
  UINT32 bitrate = 0;
  EXPECT_EQ(MFVideoFormat_H264, subtypeOf(engine->sink->added[0]));
  EXPECT_EQ(S_OK, engine->sink->added[0]->GetUINT32(MF_MT_AVG_BITRATE, &bitrate));
  EXPECT_EQ(3072000u, bitrate);

  // A camera that sends H.264 passes its stream through: no bit rate is asked for.
  ComPtr<IMFMediaType> h264 = videoType(MFVideoFormat_H264_ES, 1280, 720, 30, 1);
  engine->source->videoType = h264.Get();
  ASSERT_EQ(S_OK, manager.StopRecord());
  ASSERT_EQ(S_OK, manager.StartRecord(L"/tmp/clip.mp4"));
  ASSERT_EQ(2u, engine->sink->added.size());
  EXPECT_EQ(MFVideoFormat_H264, subtypeOf(engine->sink->added[1]));
  EXPECT_EQ(MF_E_ATTRIBUTENOTFOUND, engine->sink->added[1]->GetUINT32(MF_MT_AVG_BITRATE, &bitrate));
  engine->source->videoType = nullptr;
  manager.DestroyEngine();
}

TEST(CameraCaptureManager, AudioRecordStreamIsTheFirstAacType) {
  mfce::CaptureManager manager;
  auto* engine = fakeEngine(manager, true);
  manager.hasAudio = 1;
  ASSERT_EQ(S_OK, manager.StartRecord(L"/tmp/clip.mp4"));
  ASSERT_EQ(1u, engine->sink->added.size());
  EXPECT_EQ(DWORD{MF_CAPTURE_ENGINE_PREFERRED_SOURCE_STREAM_FOR_AUDIO}, engine->sink->sources[0]);
  EXPECT_EQ(MFAudioFormat_AAC, subtypeOf(engine->sink->added[0]));

  // A device without sound still records.
  engine->sink->audioAnswer = MF_E_INVALIDSTREAMNUMBER;
  EXPECT_EQ(S_OK, manager.StopRecord());
  EXPECT_EQ(S_OK, manager.StartRecord(L"/tmp/clip.mp4"));
  EXPECT_EQ(2, engine->startRecordCalls);
  EXPECT_EQ(S_OK, manager.StopRecord());
  engine->sink->audioAnswer = E_FAIL;
  EXPECT_EQ(E_FAIL, manager.StartRecord(L"/tmp/clip.mp4"));
  EXPECT_EQ(2, engine->startRecordCalls);
  manager.DestroyEngine();
}

TEST(CameraCaptureManager, EngineEventsSetFlagsAndSignalEveryTime) {
  mfce::CaptureManager manager;
  manager.engineEvent = CreateEventA(nullptr, FALSE, FALSE, nullptr);
  auto handle = [&](const GUID& type, HRESULT status) {
    return manager.HandleEngineEvent(new FakeEvent(type, status));
  };

  EXPECT_EQ(S_OK, handle(MF_CAPTURE_ENGINE_INITIALIZED, MF_E_NO_CAPTURE_DEVICES_AVAILABLE));
  EXPECT_TRUE(signalled(manager.engineEvent));
  EXPECT_FALSE(signalled(manager.engineEvent));  // auto-reset
  EXPECT_EQ(E_FAIL, handle(MF_CAPTURE_ENGINE_INITIALIZED, E_FAIL));

  handle(MF_CAPTURE_ENGINE_PREVIEW_STARTED, S_OK);
  EXPECT_TRUE(manager.previewing);
  handle(MF_CAPTURE_ENGINE_PREVIEW_STOPPED, S_OK);
  EXPECT_FALSE(manager.previewing);
  handle(MF_CAPTURE_ENGINE_PREVIEW_STARTED, E_FAIL);
  EXPECT_FALSE(manager.previewing);

  handle(MF_CAPTURE_ENGINE_RECORD_STARTED, S_OK);
  EXPECT_TRUE(manager.recording);
  handle(MF_CAPTURE_ENGINE_RECORD_STOPPED, S_OK);
  EXPECT_FALSE(manager.recording);
  handle(MF_CAPTURE_ENGINE_RECORD_STARTED, MF_E_INVALIDREQUEST);
  EXPECT_FALSE(manager.recording);

  manager.photoPending = true;
  handle(MF_CAPTURE_ENGINE_PHOTO_TAKEN, S_OK);
  EXPECT_FALSE(manager.photoPending);

  const GUID other = {0x12345678, 0, 0, {0, 0, 0, 0, 0, 0, 0, 1}};
  manager.previewing = true;
  EXPECT_EQ(S_FALSE, handle(other, S_FALSE));
  EXPECT_TRUE(manager.previewing);
  EXPECT_TRUE(signalled(manager.engineEvent));
  EXPECT_EQ(E_ABORT, manager.HandleEngineEvent(new FakeEvent(MF_CAPTURE_ENGINE_ERROR, E_ABORT, false)));
  EXPECT_TRUE(manager.previewing);  // an unreadable type changes nothing but still signals
  EXPECT_TRUE(signalled(manager.engineEvent));

  // The error event ends preview and recording and silences the meter; the next operation tears
  // the engine down, and later operations find none.
  fakeEngine(manager);
  manager.recording = true;
  manager.previewing = true;
  manager.leftPeak.store(0.5);
  manager.rightPeak.store(0.25);
  handle(MF_CAPTURE_ENGINE_ERROR, E_FAIL);
  EXPECT_FALSE(manager.previewing);
  EXPECT_FALSE(manager.recording);
  EXPECT_EQ(manager.leftPeak.load(), 0.0);
  EXPECT_EQ(manager.rightPeak.load(), 0.0);
  UINT32 width = 1, height = 2;
  EXPECT_EQ(MF_E_NOT_INITIALIZED, manager.ConfigurePreview(width, height));
  EXPECT_FALSE(manager.engine);
  EXPECT_EQ(nullptr, manager.engineEvent);
  EXPECT_EQ(MF_E_NOT_INITIALIZED, manager.StartPreview(nullptr));
  EXPECT_EQ(MF_E_NOT_INITIALIZED, manager.StopPreview());
  EXPECT_EQ(S_OK, manager.StopRecord());
  EXPECT_EQ(1u, width);
}

TEST(CameraCaptureManager, PreviewIsConfiguredOnceAndLaterCallsKeepTheCallersSize) {
  mfce::CaptureManager manager;
  auto* engine = fakeEngine(manager);
  manager.hasVideo = 1;
  ComPtr<IMFMediaType> yuy2 = videoType(MFVideoFormat_YUY2, 1280, 720, 30, 1);
  engine->source->videoType = yuy2.Get();

  UINT32 width = 640, height = 480;
  ASSERT_EQ(S_OK, manager.ConfigurePreview(width, height));
  EXPECT_EQ(1280u, width);
  EXPECT_EQ(720u, height);
  ASSERT_TRUE(manager.previewSink);
  ASSERT_EQ(1u, engine->preview->added.size());
  EXPECT_EQ(DWORD{MF_CAPTURE_ENGINE_PREFERRED_SOURCE_STREAM_FOR_VIDEO_PREVIEW}, engine->preview->sources[0]);
  UINT32 independent = 0;
  EXPECT_EQ(MFVideoFormat_ARGB32, subtypeOf(engine->preview->added[0]));
  EXPECT_EQ(S_OK, engine->preview->added[0]->GetUINT32(MF_MT_ALL_SAMPLES_INDEPENDENT, &independent));
  EXPECT_EQ(1u, independent);
  EXPECT_EQ(static_cast<IMFCaptureEngineOnSampleCallback*>(manager.videoSampleCallback.Get()),
            engine->preview->callbacks[0]);
  const int sinkCalls = engine->getSinkCalls;

  // Configured: the answer is S_OK and the caller's values come back as they went in.
  width = 640;
  height = 480;
  EXPECT_EQ(S_OK, manager.ConfigurePreview(width, height));
  EXPECT_EQ(640u, width);
  EXPECT_EQ(480u, height);
  EXPECT_EQ(sinkCalls, engine->getSinkCalls);
  EXPECT_EQ(1u, engine->preview->added.size());

  engine->source->videoType = nullptr;
  manager.DestroyEngine();
}

TEST(CameraCaptureManager, APreviewThatFailedAfterGettingItsSinkIsNotConfiguredAgain) {
  mfce::CaptureManager manager;
  auto* engine = fakeEngine(manager);
  manager.hasVideo = 1;
  manager.hasAudio = 1;  // the fake source has no audio stream: the audio part fails
  ComPtr<IMFMediaType> yuy2 = videoType(MFVideoFormat_YUY2, 1280, 720, 30, 1);
  engine->source->videoType = yuy2.Get();

  UINT32 width = 640, height = 480;
  EXPECT_EQ(MF_E_INVALIDSTREAMNUMBER, manager.ConfigurePreview(width, height));
  EXPECT_TRUE(manager.previewSink);
  width = 640;
  height = 480;
  EXPECT_EQ(S_OK, manager.ConfigurePreview(width, height));
  EXPECT_EQ(640u, width);
  EXPECT_EQ(480u, height);
  EXPECT_EQ(1u, engine->preview->added.size());

  // While previewing nothing is configured either.
  mfce::CaptureManager previewing;
  auto* other = fakeEngine(previewing);
  previewing.hasVideo = 1;
  other->source->videoType = yuy2.Get();
  previewing.previewing = true;
  EXPECT_EQ(S_OK, previewing.ConfigurePreview(width, height));
  EXPECT_EQ(640u, width);
  EXPECT_EQ(0, other->getSinkCalls);
  previewing.previewing = false;
  other->source->videoType = nullptr;
  engine->source->videoType = nullptr;
  previewing.DestroyEngine();
  manager.DestroyEngine();
}

// The engine answers later, on a thread of its own, as the real one does, while a signal of an
// earlier event (the initialised event) is still pending: each wait must last until its own event.
TEST(CameraCaptureManager, WaitsForTheEventOfItsOwnCommand) {
  mfce::CaptureManager manager;
  manager.engineEvent = CreateEventA(nullptr, FALSE, TRUE, nullptr);  // the initialised event's signal
  auto* engine = fakeEngine(manager);
  manager.hasAudio = 1;
  std::vector<std::thread> answers;
  engine->answer = [&](const GUID& type, HRESULT status) {
    answers.emplace_back([&manager, type, status] {
      std::this_thread::sleep_for(std::chrono::milliseconds(30));
      manager.HandleEngineEvent(new FakeEvent(type, status));
    });
  };
  for (int clip = 0; clip < 3; ++clip) {
    // Stopped the moment it started: the stop still reaches the engine and is waited for.
    ASSERT_EQ(S_OK, manager.StartRecord(L"/tmp/clip.mp4"));
    EXPECT_TRUE(manager.IsRecording());
    EXPECT_EQ(S_OK, manager.StopRecord());
    EXPECT_FALSE(manager.IsRecording());
  }
  EXPECT_EQ(3, engine->startRecordCalls);
  EXPECT_EQ(3, engine->stopRecordCalls);
  EXPECT_EQ(S_OK, manager.StartPreview(nullptr));
  EXPECT_TRUE(manager.IsPreviewing());
  EXPECT_EQ(S_OK, manager.StopPreview());
  EXPECT_FALSE(manager.IsPreviewing());
  for (std::thread& answer : answers) answer.join();
  manager.DestroyEngine();
}

TEST(CameraCaptureManager, AStartTheEngineRefusesOrAnEngineErrorEndsTheWait) {
  mfce::CaptureManager manager;
  auto* engine = fakeEngine(manager, true);
  manager.hasVideo = 1;
  ComPtr<IMFMediaType> yuy2 = videoType(MFVideoFormat_YUY2, 64, 48, 30, 1);
  engine->source->videoType = yuy2.Get();
  // The file could not be made: the start's answer carries the system's code.
  engine->recordStartStatus = HRESULT_FROM_WIN32(ERROR_PATH_NOT_FOUND);
  EXPECT_EQ(HRESULT_FROM_WIN32(ERROR_PATH_NOT_FOUND), manager.StartRecord(L"/missing/clip.mp4"));
  EXPECT_FALSE(manager.IsRecording());

  // A device lost before the engine answered: the wait ends with the engine.
  engine->source->videoType = nullptr;
  std::thread lost;
  engine->answer = [&](const GUID&, HRESULT) {
    lost = std::thread([&manager] {
      std::this_thread::sleep_for(std::chrono::milliseconds(30));
      manager.HandleEngineEvent(new FakeEvent(MF_CAPTURE_ENGINE_ERROR, MF_E_VIDEO_RECORDING_DEVICE_INVALIDATED));
    });
  };
  EXPECT_EQ(S_OK, manager.StartPreview(nullptr));
  lost.join();
  // The engine's thread leaves the engine to its owner, whose calls may be using it.
  EXPECT_TRUE(manager.engine);
  EXPECT_FALSE(manager.HasEngine());
  EXPECT_FALSE(manager.engine);
}

TEST(CameraCaptureManager, ARecordingThatCouldNotBeWrittenIsAWarningLine) {
  mfce::CaptureManager manager;
  manager.engineEvent = CreateEventA(nullptr, FALSE, FALSE, nullptr);
  manager.recording = true;
  ::testing::internal::CaptureStdout();
  manager.HandleEngineEvent(new FakeEvent(MF_CAPTURE_ENGINE_RECORD_STOPPED, HRESULT_FROM_WIN32(ERROR_DISK_FULL)));
  manager.HandleEngineEvent(new FakeEvent(MF_CAPTURE_ENGINE_RECORD_STOPPED, S_OK));
  const std::string out = ::testing::internal::GetCapturedStdout();
  EXPECT_FALSE(manager.IsRecording());
  EXPECT_NE(std::string::npos, out.find(": Warning: ")) << out;
  EXPECT_NE(std::string::npos, out.find("native/capture/video/camera/mfce/capturemanager(")) << out;
  EXPECT_NE(std::string::npos, out.find("0x80070070")) << out;
  EXPECT_NE(std::string::npos, out.find("There is not enough space on the disk.")) << out;
  EXPECT_EQ(out.find(": Warning: "), out.rfind(": Warning: ")) << "one line for the one failure: " << out;
  CloseHandle(manager.engineEvent);
  manager.engineEvent = nullptr;
}

TEST(CameraCaptureManager, CallbacksAnswerTheirOneInterfaceAndKeepNoEventTheyCannotDeliver) {
  auto* callback = new mfce::CaptureManager::CaptureEngineCB(nullptr);
  void* object = nullptr;
  EXPECT_EQ(S_OK, callback->QueryInterface(IID_IMFCaptureEngineOnEventCallback, &object));
  EXPECT_EQ(E_NOINTERFACE, callback->QueryInterface(IID_IMFCaptureEngineOnSampleCallback, &object));
  EXPECT_EQ(nullptr, object);
  // An event before the source handles them directly, with no window to post to, keeps no reference.
  auto* event = new FakeEvent(MF_CAPTURE_ENGINE_INITIALIZED, S_OK);
  EXPECT_EQ(S_OK, callback->OnEvent(event));
  EXPECT_EQ(0u, event->Release());
  EXPECT_EQ(1u, callback->Release());
  EXPECT_EQ(0u, callback->Release());
}

// The camera source over a real engine reading a lavfi test pattern (no camera needed).
class CameraSource : public ::testing::Test {
 protected:
  static IMFActivate* device(const GUID& category, const wchar_t* name, const wchar_t* link) {
    IMFActivate* activate = nullptr;
    EXPECT_EQ(S_OK, platform::createDeviceActivate(category, name, link, &activate));
    return activate;
  }
};

TEST_F(CameraSource, KindNameAndAudioAnswers) {
  IMFActivate* camera =
      device(MF_DEVSOURCE_ATTRIBUTE_SOURCE_TYPE_VIDCAP_GUID, L"Red Camera", L"lavfi:color=c=red:size=160x120:rate=30");
  {
    mfce::MFCESource source(nullptr, camera, true);
    EXPECT_EQ(3, source.type());
    EXPECT_TRUE(source.isVideo());
    EXPECT_EQ("Red Camera", source.name());
    EXPECT_TRUE(source.selected());
    EXPECT_EQ(2, source.channels());
    EXPECT_EQ(0.0, source.peak(0));
    EXPECT_EQ(0.0, source.peak(2));
    EXPECT_EQ(0u, source.width());
    uint8_t pixel[4] = {7, 7, 7, 7};
    EXPECT_FALSE(source.preview(pixel, 0, 1, 1));
    EXPECT_EQ(7, pixel[0]);
    EXPECT_EQ("Red Camera: text", source.log("text"));
  }
  camera->Release();

  mfce::MFCESource nothing(nullptr, nullptr, false);
  EXPECT_EQ("No audio or video device specified", nothing.name());
  EXPECT_EQ(3, nothing.type());
  EXPECT_FALSE(nothing.selected());
}

TEST_F(CameraSource, PreviewShowsTheCameraAndEachStartIsAClipOfItsOwn) {
  IMFActivate* camera =
      device(MF_DEVSOURCE_ATTRIBUTE_SOURCE_TYPE_VIDCAP_GUID, L"Red Camera", L"lavfi:color=c=red:size=160x120:rate=30");
  mfce::MFCESource source(nullptr, camera, false);
  camera->Release();
  source.stopEncode();  // nothing recording: quiet
  source.startPreview();
  EXPECT_EQ(160u, source.width());
  EXPECT_EQ(120u, source.height());
  EXPECT_EQ(160 * 120 * 4, source.size());
  std::vector<uint8_t> picture(16 * 12 * 4, 0);
  bool shown = false;
  for (int i = 0; i < 200 && !shown; ++i) {
    shown = source.preview(picture.data(), 0, 16, 12);
    if (!shown) std::this_thread::sleep_for(std::chrono::milliseconds(10));
  }
  ASSERT_TRUE(shown);
  // Memory order B, G, R, A: red is the third byte.
  EXPECT_LT(picture[0], 30);
  EXPECT_LT(picture[1], 30);
  EXPECT_GT(picture[2], 220);
  EXPECT_TRUE(source.preview(picture.data(), 1, 16, 12));  // the frame stays for the next reader
  EXPECT_GT(picture[0], 220);

  // A start while recording ends the running clip: two files.
  const std::string paths[2] = {::testing::TempDir() + "camera_test_clip.mp4",
                                ::testing::TempDir() + "camera_test_next.mp4"};
  for (const std::string& path : paths) {
    std::remove(path.c_str());
    source.startEncode(path);
    EXPECT_TRUE(eventually([&] { return source.manager()->IsRecording(); }));
    std::this_thread::sleep_for(std::chrono::milliseconds(300));
  }
  source.stopEncode();
  EXPECT_TRUE(eventually([&] { return !source.manager()->IsRecording(); }));
  source.stopEncode();
  for (const std::string& path : paths) {
    ASSERT_TRUE(std::filesystem::exists(path)) << path;
    EXPECT_GT(std::filesystem::file_size(path), 1000u) << path;
    std::remove(path.c_str());
  }

  const std::string refused = ::testing::TempDir() + "camera_test_clip.MP4";
  // Only ".mp4" records; the refusal says so, with the name.
  const std::string text = testsupport::failureOf([&] { source.startEncode(refused); });
  EXPECT_NE(std::string::npos, text.find("mfcesource(312): 0xc00d36b4")) << text;
  EXPECT_NE(std::string::npos, text.find(refused)) << text;
  EXPECT_FALSE(source.manager()->IsRecording());
  EXPECT_FALSE(std::filesystem::exists(refused));
  source.stopPreview();
  EXPECT_TRUE(eventually([&] { return !source.manager()->IsPreviewing(); }));
}
