// The Linux capture engine. Its cameras that send H.264 are raw H.264 files read through FFmpeg's
// h264 demuxer, as a V4L2 camera's stream is read: start-code packets with the parameter sets
// before each key frame, no key frame on request, and a first packet that is not a key frame (the
// stream was joined between two). Those are read as fast as the file gives them; a camera that
// must keep real time is the lavfi test camera that encodes itself.
#include <gtest/gtest.h>

#include <chrono>
#include <cmath>
#include <condition_variable>
#include <fstream>
#include <mutex>
#include <thread>
#include <vector>

#include "media.h"
#include "platform/com.h"
#include "platform/kernel32.h"
#include "platform/linux/ffmpeg/evenpicture.h"
#include "platform/linux/mfcapture.h"
#include "platform/linux/capture/testcameragraph.h"
#include "support.h"

namespace {

class Events : public platform::ComObject<IMFCaptureEngineOnEventCallback, IID_IMFCaptureEngineOnEventCallback> {
 public:
  HRESULT OnEvent(IMFMediaEvent* event) override {
    GUID type = GUID_NULL;
    HRESULT status = S_OK;
    event->GetExtendedType(&type);
    event->GetStatus(&status);
    std::lock_guard<std::mutex> lock(mutex_);
    seen_.emplace_back(type, status);
    changed_.notify_all();
    return S_OK;
  }

  // The status of the nth event (from 1) of this type, waiting up to 20 seconds for it; S_FALSE if
  // none came.
  HRESULT waitFor(const GUID& type, int nth = 1) {
    std::unique_lock<std::mutex> lock(mutex_);
    HRESULT status = S_FALSE;
    changed_.wait_for(lock, std::chrono::seconds(20), [&] {
      int seen = 0;
      for (const auto& [seenType, seenStatus] : seen_)
        if (seenType == type && ++seen == nth) {
          status = seenStatus;
          return true;
        }
      return false;
    });
    return status;
  }

  // The types of the events so far, in order.
  std::vector<GUID> types() {
    std::lock_guard<std::mutex> lock(mutex_);
    std::vector<GUID> result;
    for (const auto& seen : seen_) result.push_back(seen.first);
    return result;
  }

 private:
  std::mutex mutex_;
  std::condition_variable changed_;
  std::vector<std::pair<GUID, HRESULT>> seen_;
};

// The camera's packets from `first` on, one after the other in a raw H.264 file.
void writeRawStream(const std::string& path, const media::CameraStream& camera, size_t first) {
  std::ofstream file(path, std::ios::binary);
  for (size_t i = first; i < camera.packets.size(); ++i)
    file.write(reinterpret_cast<const char*>(camera.packets[i].data()), camera.packets[i].size());
}

// An engine initialised for the camera behind `link`, with its event callback.
struct InitializedEngine {
  explicit InitializedEngine(const std::wstring& link) {
    ComPtr<IMFCaptureEngineClassFactory> factory;
    EXPECT_EQ(
        platform::createCaptureEngineClassFactory(IID_IMFCaptureEngineClassFactory, reinterpret_cast<void**>(&factory)),
        S_OK);
    EXPECT_EQ(factory->CreateInstance(CLSID_MFCaptureEngine, IID_IMFCaptureEngine, reinterpret_cast<void**>(&engine)),
              S_OK);
    EXPECT_EQ(platform::createDeviceActivate(MF_DEVSOURCE_ATTRIBUTE_SOURCE_TYPE_VIDCAP_GUID, L"Camera", link, &device),
              S_OK);
    EXPECT_EQ(engine->Initialize(events.Get(), nullptr, nullptr, device.Get()), S_OK);
    EXPECT_EQ(events->waitFor(MF_CAPTURE_ENGINE_INITIALIZED), S_OK);
  }
  ComPtr<IMFCaptureEngine> engine;
  ComPtr<IMFActivate> device;
  ComPtr<Events> events = adopt(new Events);
};

// The camera's current record stream type.
ComPtr<IMFMediaType> deviceType(IMFCaptureEngine* engine) {
  ComPtr<IMFCaptureSource> source;
  ComPtr<IMFMediaType> type;
  EXPECT_EQ(engine->GetSource(&source), S_OK);
  EXPECT_EQ(source->GetCurrentDeviceMediaType(MF_CAPTURE_ENGINE_PREFERRED_SOURCE_STREAM_FOR_VIDEO_RECORD, &type), S_OK);
  return type;
}

// Gives the engine's record sink one H.264 stream of the camera's size (with `bitRate` when it is
// not 0) and the clip's name.
void prepareRecord(IMFCaptureEngine* engine, const std::string& clip, UINT32 bitRate) {
  ComPtr<IMFMediaType> recordType;
  MFCreateMediaType(&recordType);
  deviceType(engine)->CopyAllItems(recordType.Get());
  recordType->SetGUID(MF_MT_SUBTYPE, MFVideoFormat_H264);
  if (bitRate) recordType->SetUINT32(MF_MT_AVG_BITRATE, bitRate);
  ComPtr<IMFCaptureSink> sink;
  ComPtr<IMFCaptureRecordSink> recordSink;
  EXPECT_EQ(engine->GetSink(MF_CAPTURE_ENGINE_SINK_TYPE_RECORD, &sink), S_OK);
  EXPECT_EQ(sink->QueryInterface(IID_IMFCaptureRecordSink, reinterpret_cast<void**>(&recordSink)), S_OK);
  DWORD index = 0;
  EXPECT_EQ(recordSink->RemoveAllStreams(), S_OK);
  EXPECT_EQ(recordSink->AddStream(MF_CAPTURE_ENGINE_PREFERRED_SOURCE_STREAM_FOR_VIDEO_RECORD, recordType.Get(), nullptr,
                                  &index),
            S_OK);
  EXPECT_EQ(recordSink->SetOutputFileName(platform::widen(clip).c_str()), S_OK);
}

// Records the H.264 camera behind `link` with an engine whose record stream asks for H.264 of the
// camera's size, with `bitRate` when it is not 0; returns once the camera has ended (the end of a
// device ends the recording and finishes the file).
void record(const std::wstring& link, const std::string& clip, UINT32 bitRate) {
  InitializedEngine initialized(link);
  GUID subtype = GUID_NULL;
  deviceType(initialized.engine.Get())->GetGUID(MF_MT_SUBTYPE, &subtype);
  EXPECT_EQ(subtype, MFVideoFormat_H264);
  prepareRecord(initialized.engine.Get(), clip, bitRate);
  EXPECT_EQ(initialized.engine->StartRecord(), S_OK);
  EXPECT_EQ(initialized.events->waitFor(MF_CAPTURE_ENGINE_RECORD_STARTED), S_OK);
  EXPECT_EQ(initialized.events->waitFor(MF_CAPTURE_ENGINE_ERROR), MF_E_VIDEO_RECORDING_DEVICE_INVALIDATED);
}

TEST(LinuxCaptureEngine, H264CameraIsRecordedAsItSendsItFromItsFirstKeyFrame) {
  media::MediaFoundation started;
  media::TempFolder folder;
  const media::CameraStream camera = media::cameraStream(160, 120, 75, 30, false);
  ASSERT_EQ(camera.packets.size(), 75u);
  writeRawStream(folder.file("camera.h264"), camera, 10);  // joined a third into its first group
  const std::string clip = folder.file("clip.mp4");
  record(platform::widen("h264:" + folder.file("camera.h264")), clip, 0);

  // Packets 30 to 74 of the camera: the first key frame on, at 0 and a frame apart.
  const std::vector<bool> keys(camera.keys.begin() + 30, camera.keys.end());
  ASSERT_TRUE(keys[0]);
  const media::File file = media::probe(clip);
  ASSERT_TRUE(file.opened);
  ASSERT_EQ(file.streams.size(), 1u);
  const media::Stream& video = file.streams[0];
  EXPECT_EQ(video.codec, "h264");
  EXPECT_EQ(video.profile, FF_PROFILE_H264_HIGH);  // the camera's; the engine's own encoding is Baseline
  ASSERT_EQ(video.packets.size(), keys.size());
  // The first packet opens the clip at 0; the others keep the camera's spacing after it, placed
  // by when the camera's first one came (the device opens after the start).
  EXPECT_EQ(video.packets[0].time, 0.0);
  for (size_t i = 2; i < video.packets.size(); ++i)
    EXPECT_NEAR(video.packets[i].time - video.packets[i - 1].time, 1 / 30.0, 1e-3) << "packet " << i;
  EXPECT_EQ(media::containerKeys(clip), keys);
  const media::Decoded decoded = media::decode(clip, AVMEDIA_TYPE_VIDEO);
  EXPECT_EQ(decoded.errors, 0);
  EXPECT_EQ(decoded.frames, static_cast<int>(keys.size()));
}

// A camera that sends H.264 in real time (the lavfi test camera that encodes itself, for two
// seconds), recorded with a bit rate of its own: encoded again, as Baseline, every picture on the
// grid of the camera's rate, one a slot.
TEST(LinuxCaptureEngine, H264CameraIsEncodedAgainOnItsFrameGridWhenTheRecordStreamHasABitRate) {
  media::MediaFoundation started;
  media::TempFolder folder;
  const std::string clip = folder.file("clip.mp4");
  record(L"lavfi:h264:testsrc2=size=160x120:rate=30:duration=2", clip, 500000);

  const media::File file = media::probe(clip);
  ASSERT_TRUE(file.opened);
  ASSERT_EQ(file.streams.size(), 1u);
  const media::Stream& video = file.streams[0];
  EXPECT_EQ(video.codec, "h264");
  EXPECT_EQ(video.profile & ~FF_PROFILE_H264_CONSTRAINED, FF_PROFILE_H264_BASELINE);
  const media::Decoded decoded = media::decode(clip, AVMEDIA_TYPE_VIDEO);
  EXPECT_EQ(decoded.errors, 0);
  ASSERT_GE(video.packets.size(), 40u);  // the camera's two seconds less its start
  long last = -1;
  for (const media::Packet& packet : video.packets) {
    const double slot = packet.time * 30;
    EXPECT_NEAR(slot, std::round(slot), 0.01) << packet.time;
    EXPECT_GT(std::lround(slot), last) << packet.time;
    last = std::lround(slot);
  }
  // A picture a slot from the first to the last, give or take one that jittered into a neighbour's.
  EXPECT_GE(video.packets.size() + 2, static_cast<size_t>(last + 1));
}

// Keeps the first picture it is given and remembers its bytes as they were then; counts the rest.
class KeepFirstPicture
    : public platform::ComObject<IMFCaptureEngineOnSampleCallback, IID_IMFCaptureEngineOnSampleCallback> {
 public:
  ~KeepFirstPicture() override {
    if (kept_) kept_->Release();
  }
  HRESULT OnSample(IMFSample* sample) override {
    std::lock_guard<std::mutex> lock(mutex_);
    if (!kept_) {
      kept_ = sample;
      kept_->AddRef();
      bytesAtDelivery_ = bytes(sample);
    }
    ++pictures_;
    return S_OK;
  }
  int pictures() {
    std::lock_guard<std::mutex> lock(mutex_);
    return pictures_;
  }
  // The kept picture's bytes now, and as they were when it came.
  std::pair<std::vector<uint8_t>, std::vector<uint8_t>> kept() {
    std::lock_guard<std::mutex> lock(mutex_);
    return {kept_ ? bytes(kept_) : std::vector<uint8_t>{}, bytesAtDelivery_};
  }

 private:
  static std::vector<uint8_t> bytes(IMFSample* sample) {
    IMFMediaBuffer* buffer = nullptr;
    if (FAILED(sample->GetBufferByIndex(0, &buffer))) return {};
    BYTE* data = nullptr;
    DWORD length = 0;
    buffer->Lock(&data, nullptr, &length);
    std::vector<uint8_t> copy(data, data + length);
    buffer->Unlock();
    buffer->Release();
    return copy;
  }

  std::mutex mutex_;
  IMFSample* kept_ = nullptr;
  std::vector<uint8_t> bytesAtDelivery_;
  int pictures_ = 0;
};

// The engine writes picture after picture into one buffer when it can; a picture that a preview
// callback still holds must keep its bytes.
TEST(LinuxCaptureEngine, APictureACallbackKeepsIsNotOverwrittenByTheNextOnes) {
  media::MediaFoundation started;
  // Every picture differs from the one before: the pattern moves.
  InitializedEngine initialized(L"lavfi:testsrc2=size=64x48:rate=30");
  IMFCaptureEngine* engine = initialized.engine.Get();
  Events* events = initialized.events.Get();

  IMFCaptureSink* sink = nullptr;
  IMFCapturePreviewSink* previewSink = nullptr;
  IMFMediaType* type = nullptr;
  EXPECT_EQ(engine->GetSink(MF_CAPTURE_ENGINE_SINK_TYPE_PREVIEW, &sink), S_OK);
  EXPECT_EQ(sink->QueryInterface(IID_IMFCapturePreviewSink, reinterpret_cast<void**>(&previewSink)), S_OK);
  MFCreateMediaType(&type);
  type->SetGUID(MF_MT_MAJOR_TYPE, MFMediaType_Video);
  type->SetGUID(MF_MT_SUBTYPE, MFVideoFormat_ARGB32);
  DWORD index = 0;
  EXPECT_EQ(previewSink->AddStream(MF_CAPTURE_ENGINE_PREFERRED_SOURCE_STREAM_FOR_VIDEO_PREVIEW, type, nullptr, &index),
            S_OK);
  auto* callback = new KeepFirstPicture;
  EXPECT_EQ(previewSink->SetSampleCallback(index, callback), S_OK);
  EXPECT_EQ(engine->StartPreview(), S_OK);
  EXPECT_EQ(events->waitFor(MF_CAPTURE_ENGINE_PREVIEW_STARTED), S_OK);
  EXPECT_TRUE(testsupport::eventually([&] { return callback->pictures() >= 10; }));
  EXPECT_EQ(engine->StopPreview(), S_OK);
  EXPECT_EQ(events->waitFor(MF_CAPTURE_ENGINE_PREVIEW_STOPPED), S_OK);

  const auto [now, atDelivery] = callback->kept();
  ASSERT_EQ(atDelivery.size(), 64u * 48u * 4u);
  EXPECT_TRUE(now == atDelivery);
  for (IUnknown* object : std::initializer_list<IUnknown*>{type, previewSink, sink, callback}) object->Release();
}

// Odd sizes are recorded at the next even size, the last column and row repeated.
TEST(LinuxCaptureEngine, OddPicturesArePaddedToEvenWithTheirLastColumnAndRow) {
  EXPECT_EQ(platform::evenpicture::evenSize(1), 2);
  EXPECT_EQ(platform::evenpicture::evenSize(32), 32);
  EXPECT_EQ(platform::evenpicture::evenSize(33), 34);
  // 3x3 pixels whose four bytes are all their index.
  std::vector<uint8_t> source;
  for (uint8_t pixel = 0; pixel < 9; ++pixel) source.insert(source.end(), 4, pixel);
  std::vector<uint8_t> padded(4 * 4 * 4, 0xEE);
  platform::evenpicture::pad(source.data(), 3, 3, padded.data());
  const uint8_t expected[4][4] = {{0, 1, 2, 2}, {3, 4, 5, 5}, {6, 7, 8, 8}, {6, 7, 8, 8}};
  for (int y = 0; y < 4; ++y)
    for (int x = 0; x < 4; ++x)
      for (int byte = 0; byte < 4; ++byte) EXPECT_EQ(padded[(y * 4 + x) * 4 + byte], expected[y][x]) << x << "," << y;
}

// Test cameras take generators and drawing filters; anything else, file readers and writers
// above all, is refused, however its graph is written.
TEST(LinuxCaptureEngine, TestCameraGraphsTakeOnlyGeneratorsAndDrawingFilters) {
  using platform::testcamera::filterNames;
  using platform::testcamera::refusedFilter;
  EXPECT_EQ(filterNames("testsrc2=size=640x480:rate=30, drawbox=x=0:y=0:w=320:h=60:color=red:t=fill"),
            (std::vector<std::string>{"testsrc2", "drawbox"}));
  EXPECT_EQ(filterNames("color@bg=c=red[a];[a]scale=w='iw\\,2':h=2[out]"),
            (std::vector<std::string>{"color", "scale"}));
  for (const char* graph :
       {"testsrc2=size=640x480:rate=30", "color=c=red:size=1x1:rate=30", "smptebars", "mandelbrot=size=320x240",
        "color=c=blue:size=320x240,drawbox=x=0:y=0:w=9:h=9:t=fill", "testsrc=d=5,format=yuyv422,realtime"})
    EXPECT_EQ(refusedFilter(graph), "") << graph;
  const std::pair<const char*, const char*> refused[] = {
      {"movie=/etc/passwd", "movie"},
      {"amovie=/tmp/a.wav", "amovie"},
      {"color=c=red,drawtext=textfile=/etc/shadow", "drawtext"},
      {"testsrc2,metadata=mode=print:file=/tmp/out", "metadata"},
      {"testsrc2 , 'mov'ie=/etc/passwd", "movie"},  // spaces and quotes do not hide a filter
      {"[in]movie=/etc/passwd", "movie"},
      {"testsrc2;movie=/etc/passwd[b]", "movie"},
      {"drawbox", "drawbox"},  // a filter with no source
      {"", "(no name)"},
  };
  for (const auto& [graph, filter] : refused) EXPECT_EQ(refusedFilter(graph), filter) << graph;
}

// A handle closed while another thread waits on it keeps its object until that wait returns (under
// AddressSanitizer a freed object in use fails the run).
TEST(LinuxCaptureEngine, AnEventClosedWhileWaitedOnLivesUntilTheWaitEnds) {
  HANDLE event = CreateEventA(nullptr, FALSE, FALSE, nullptr);
  ASSERT_NE(event, nullptr);
  std::mutex mutex;
  std::condition_variable entered;
  bool waiting = false;
  DWORD result = WAIT_FAILED;
  std::thread waiter([&] {
    {
      std::lock_guard<std::mutex> lock(mutex);
      waiting = true;
    }
    entered.notify_all();
    result = WaitForSingleObject(event, 300);
  });
  {
    std::unique_lock<std::mutex> lock(mutex);
    entered.wait(lock, [&] { return waiting; });
  }
  std::this_thread::sleep_for(std::chrono::milliseconds(30));
  EXPECT_TRUE(CloseHandle(event));  // nobody can signal it now: the wait ends by its time-out
  waiter.join();
  EXPECT_EQ(result, static_cast<DWORD>(WAIT_TIMEOUT));
}

// Clips started and stopped back to back, the second stopped the moment it started: the engine
// answers each command in order, and each clip is a file of its own with the pictures of its time.
TEST(LinuxCaptureEngine, BackToBackClipsAreAnsweredInOrderAndEachIsAFile) {
  media::MediaFoundation started;
  media::TempFolder folder;
  InitializedEngine initialized(L"lavfi:testsrc2=size=64x48:rate=30");
  IMFCaptureEngine* engine = initialized.engine.Get();
  Events* events = initialized.events.Get();
  const std::string clips[] = {folder.file("first.mp4"), folder.file("second.mp4")};

  prepareRecord(engine, clips[0], 200000);
  EXPECT_EQ(engine->StartRecord(), S_OK);
  EXPECT_EQ(events->waitFor(MF_CAPTURE_ENGINE_RECORD_STARTED), S_OK);
  std::this_thread::sleep_for(std::chrono::milliseconds(300));
  EXPECT_EQ(engine->StopRecord(TRUE, FALSE), S_OK);
  EXPECT_EQ(events->waitFor(MF_CAPTURE_ENGINE_RECORD_STOPPED), S_OK);
  prepareRecord(engine, clips[1], 200000);
  EXPECT_EQ(engine->StartRecord(), S_OK);
  EXPECT_EQ(events->waitFor(MF_CAPTURE_ENGINE_RECORD_STARTED, 2), S_OK);
  EXPECT_EQ(engine->StopRecord(TRUE, FALSE), S_OK);
  EXPECT_EQ(events->waitFor(MF_CAPTURE_ENGINE_RECORD_STOPPED, 2), S_OK);
  const std::vector<GUID> order{MF_CAPTURE_ENGINE_INITIALIZED, MF_CAPTURE_ENGINE_RECORD_STARTED,
                                MF_CAPTURE_ENGINE_RECORD_STOPPED, MF_CAPTURE_ENGINE_RECORD_STARTED,
                                MF_CAPTURE_ENGINE_RECORD_STOPPED};
  EXPECT_TRUE(events->types() == order);

  for (const std::string& clip : clips) {
    const media::File file = media::probe(clip);
    ASSERT_TRUE(file.opened) << clip;
    ASSERT_EQ(file.streams.size(), 1u);
    const media::Decoded decoded = media::decode(clip, AVMEDIA_TYPE_VIDEO);
    EXPECT_EQ(decoded.errors, 0);
    EXPECT_GE(decoded.frames, 1) << clip;
  }
  EXPECT_GE(media::decode(clips[0], AVMEDIA_TYPE_VIDEO).frames, 5);  // 300 ms at 30 a second, give or take a few
}

}  // namespace
