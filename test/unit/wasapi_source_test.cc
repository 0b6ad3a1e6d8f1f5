#include <gtest/gtest.h>

#include <algorithm>
#include <chrono>
#include <cstring>
#include <memory>
#include <sstream>
#include <stdexcept>
#include <string>
#include <thread>
#include <vector>

#include "capture/audio/wasapi/source.h"
#include "fakes/audio.h"
#include "platform/kernel32.h"
#include "support.h"

namespace {

using testsupport::eventually;

WAVEFORMATEXTENSIBLE stereoFloat(DWORD rate = 48000) {
  return testsupport::waveFormat(2, rate, 32, KSDATAFORMAT_SUBTYPE_IEEE_FLOAT,
                                 SPEAKER_FRONT_LEFT | SPEAKER_FRONT_RIGHT);
}

fakes::Packet floats(std::vector<float> samples, UINT64 qpc, DWORD flags = 0, UINT64 device = 0) {
  fakes::Packet packet;
  packet.bytes.resize(samples.size() * sizeof(float));
  if (!samples.empty()) std::memcpy(packet.bytes.data(), samples.data(), packet.bytes.size());
  packet.frames = static_cast<UINT32>(samples.size() / 2);
  packet.flags = flags;
  packet.qpcPosition = qpc;
  packet.devicePosition = device;
  return packet;
}

fakes::Packet answer(HRESULT result) {
  fakes::Packet packet;
  packet.result = result;
  return packet;
}

// Lines the process wrote to standard output while a test ran a capture thread.
class Output {
 public:
  Output() { testing::internal::CaptureStdout(); }
  std::vector<std::string> lines() {
    std::istringstream text(testing::internal::GetCapturedStdout());
    std::vector<std::string> result;
    for (std::string line; std::getline(text, line);) result.push_back(line);
    return result;
  }
};

int count(const std::vector<std::string>& lines, const std::string& part) {
  return static_cast<int>(std::count_if(lines.begin(), lines.end(),
                                        [&](const std::string& line) { return line.find(part) != std::string::npos; }));
}

class WasapiSource : public testing::Test {
 protected:
  void SetUp() override {
    audio->mix = stereoFloat();
    endpoint = new fakes::Endpoint(audio, L"Speakers \U0001F50A");
    source = std::make_shared<capture::audio::wasapi::Source>(
        endpoint, true, [this](const std::string& path, const WAVEFORMATEXTENSIBLE* format) {
          auto log = std::make_shared<fakes::EncoderLog>();
          log->path = path;
          encoders.push_back(log);
          formatsGiven.push_back(format);
          return new fakes::Encoder(log);
        });
  }

  void TearDown() override {
    if (source) endCapture();
  }

  // Starts the capture thread and waits until it has read the format and started its client.
  void startCapture() {
    source->capture();
    ASSERT_TRUE(audio->waitFor([&] {
      return std::any_of(audio->initializations.begin(), audio->initializations.end(),
                         [](const fakes::AudioLog::Init& init) { return init.flags != 0; }) &&
             audio->starts >= 1 && source->channels() != 0;
    }));
  }

  // Stops the capture thread and waits until it has let go of the source.
  void endCapture() {
    std::weak_ptr<capture::audio::wasapi::Source> watch = source;
    source->stopCapturing();
    source.reset();
    const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(10);
    while (!watch.expired() && std::chrono::steady_clock::now() < deadline)
      std::this_thread::sleep_for(std::chrono::milliseconds(1));
    EXPECT_TRUE(watch.expired()) << "the capture thread did not end";
  }

  // Changes the endpoint's script under its lock.
  template <class Change>
  void script(Change change) {
    std::lock_guard<std::mutex> lock(audio->mutex);
    change();
  }

  // Waits until the clip of encoder `index` is finished.
  bool finished(size_t index) {
    return eventually([&] {
      std::lock_guard<std::mutex> lock(encoders[index]->mutex);
      return encoders[index]->finalized == 1;
    });
  }

  void feed(fakes::Packet packet) {
    const int before = answered();
    audio->push(std::move(packet));
    ASSERT_TRUE(audio->waitAnswered(before + 1));
  }

  int answered() {
    std::lock_guard<std::mutex> lock(audio->mutex);
    return audio->answered;
  }

  std::shared_ptr<fakes::AudioLog> audio = std::make_shared<fakes::AudioLog>();
  fakes::Endpoint* endpoint = nullptr;
  std::shared_ptr<capture::audio::wasapi::Source> source;
  std::vector<std::shared_ptr<fakes::EncoderLog>> encoders;
  std::vector<const WAVEFORMATEXTENSIBLE*> formatsGiven;
};

TEST_F(WasapiSource, DescribesItselfBeforeCapture) {
  EXPECT_TRUE(source->selected());
  EXPECT_EQ(source->name(), "Speakers \xF0\x9F\x94\x8A");
  EXPECT_EQ(source->channels(), 0);
  try {
    source->peak(0);
    ADD_FAILURE() << "peak(0) before capture returned";
  } catch (const std::out_of_range& e) {
    EXPECT_STREQ(e.what(), "invalid vector<T> subscript");
  }
}

TEST_F(WasapiSource, SilenceThreadRefillsWhatThePlaybackBufferLacks) {
  script([&] { audio->paddings = {4800, 1000, 4800, 4700}; });
  ASSERT_TRUE(audio->waitFor([&] { return audio->silenceReleases.size() >= 2; }));
  std::lock_guard<std::mutex> lock(audio->mutex);
  ASSERT_GE(audio->initializations.size(), 1u);
  const fakes::AudioLog::Init& init = audio->initializations.front();
  EXPECT_EQ(init.mode, AUDCLNT_SHAREMODE_SHARED);
  EXPECT_EQ(init.flags, 0u);
  EXPECT_EQ(init.duration, 1000000);
  EXPECT_EQ(init.periodicity, 0);
  EXPECT_FALSE(init.sessionGuid);
  EXPECT_EQ(std::memcmp(&init.format, &audio->mix, sizeof(WAVEFORMATEXTENSIBLE)), 0);
  EXPECT_EQ(audio->silenceRequests, (std::vector<UINT32>{3800, 100}));
  EXPECT_EQ(audio->silenceReleases[0], std::make_pair(UINT32{3800}, DWORD{AUDCLNT_BUFFERFLAGS_SILENT}));
  EXPECT_EQ(audio->silenceReleases[1], std::make_pair(UINT32{100}, DWORD{AUDCLNT_BUFFERFLAGS_SILENT}));
}

TEST_F(WasapiSource, CaptureOpensLoopbackOnceAndPreviewsPeaks) {
  startCapture();
  source->capture();  // already running: no second thread
  {
    std::lock_guard<std::mutex> lock(audio->mutex);
    const auto loopback = std::find_if(audio->initializations.begin(), audio->initializations.end(),
                                       [](const fakes::AudioLog::Init& init) { return init.flags != 0; });
    EXPECT_EQ(loopback->flags, AUDCLNT_STREAMFLAGS_LOOPBACK);
    EXPECT_EQ(loopback->duration, 1000000);
    EXPECT_EQ(std::memcmp(&loopback->format, &audio->mix, sizeof(WAVEFORMATEXTENSIBLE)), 0);
  }
  EXPECT_EQ(source->channels(), 2);
  EXPECT_EQ(source->peak(0), 0.0);
  EXPECT_EQ(source->peak(1), 0.0);
  EXPECT_THROW(source->peak(2), std::out_of_range);

  feed(floats({0.5f, -0.25f}, 100));  // preview off: peaks stay
  EXPECT_EQ(source->peak(0), 0.0);
  source->startPreview();
  feed(floats({0.5f, -0.25f, -0.75f, 0.125f}, 200));
  EXPECT_EQ(source->peak(0), 0.75);
  EXPECT_EQ(source->peak(1), 0.25);
  source->stopPreview();
  feed(floats({0.0f, 0.0f}, 300));
  EXPECT_EQ(source->peak(0), 0.75);
  {
    std::lock_guard<std::mutex> lock(audio->mutex);
    EXPECT_EQ(audio->captureReleases, (std::vector<UINT32>{1, 2, 1}));
  }
  endCapture();
  // The silence thread activates its client on its own schedule.
  ASSERT_TRUE(audio->waitFor([&] { return audio->activations >= 2; }));
  std::lock_guard<std::mutex> lock(audio->mutex);
  EXPECT_EQ(audio->activations, 2) << "one client for silence, one for capture";
}

TEST_F(WasapiSource, ClosestMatchReplacesTheWaveFieldsAndIsDescribed) {
  WAVEFORMATEXTENSIBLE closest = stereoFloat(44100);
  closest.Format.wFormatTag = WAVE_FORMAT_PCM;
  closest.Format.nChannels = 1;
  closest.Format.wBitsPerSample = 16;
  closest.Format.nBlockAlign = 2;
  closest.Format.nAvgBytesPerSec = 88200;
  closest.Format.cbSize = 0;
  closest.dwChannelMask = 0x4;
  closest.SubFormat = KSDATAFORMAT_SUBTYPE_PCM;
  script([&] {
    audio->formatAnswer = S_FALSE;
    audio->closest = closest;
  });
  Output output;
  startCapture();
  endCapture();
  std::vector<std::string> lines = output.lines();
  std::lock_guard<std::mutex> lock(audio->mutex);
  const auto loopback = std::find_if(audio->initializations.begin(), audio->initializations.end(),
                                     [](const fakes::AudioLog::Init& init) { return init.flags != 0; });
  const WAVEFORMATEX& used = loopback->format.Format;
  EXPECT_EQ(used.wFormatTag, WAVE_FORMAT_PCM);
  EXPECT_EQ(used.nChannels, 1);
  EXPECT_EQ(used.nSamplesPerSec, 44100u);
  EXPECT_EQ(used.nAvgBytesPerSec, 88200u);
  EXPECT_EQ(used.nBlockAlign, 2);
  EXPECT_EQ(used.wBitsPerSample, 16);
  // The extensible part is the mix format's.
  EXPECT_EQ(used.cbSize, 22);
  EXPECT_EQ(loopback->format.dwChannelMask, 3u);
  EXPECT_TRUE(loopback->format.SubFormat == KSDATAFORMAT_SUBTYPE_IEEE_FLOAT);
  EXPECT_EQ(count(lines, "Format: 1"), 1);
  EXPECT_EQ(count(lines, "Channels: 1"), 1);
  EXPECT_EQ(count(lines, "Samples Per Sec: 44100"), 1);
  EXPECT_EQ(count(lines, "Size: 0"), 1);
}

TEST_F(WasapiSource, OtherFormatAnswersAreIgnored) {
  script([&] { audio->formatAnswer = E_FAIL; });
  Output output;
  startCapture();
  endCapture();
  EXPECT_EQ(count(output.lines(), "Samples Per Sec: "), 0);
  std::lock_guard<std::mutex> lock(audio->mutex);
  EXPECT_EQ(std::memcmp(&audio->initializations.back().format, &audio->mix, sizeof(WAVEFORMATEXTENSIBLE)), 0);
}

// The base follows every packet while not encoding; the first recorded packet keeps the base of
// the packet before it, and every later one is timed from there.
// The capture clock, as packets are stamped on it (100 ns units).
UINT64 clockNow() {
  LARGE_INTEGER count{};
  QueryPerformanceCounter(&count);
  return static_cast<UINT64>(count.QuadPart);
}

constexpr UINT64 kMs = 10000;
constexpr UINT64 kFrame = 10000000 / 48000;  // whole units per frame at 48 kHz, rounded down

std::vector<float> tone(size_t frames) { return std::vector<float>(frames * 2, 0.25f); }

// The frames of all of a clip's writes; the caller holds the log's lock.
uint64_t framesOf(const fakes::EncoderLog& log) {
  uint64_t frames = 0;
  for (const auto& write : log.writes) frames += write.frames;
  return frames;
}

bool silent(const fakes::EncoderLog::Write& write) {
  return std::all_of(write.samples.begin(), write.samples.end(), [](float v) { return v == 0.0f; });
}

TEST_F(WasapiSource, AClipTakesTheFramesFromItsStartToItsStopTimedFromItsStart) {
  startCapture();
  feed(floats(tone(960), clockNow() - 200 * kMs));  // before the clip: nobody records it
  const UINT64 beforeStart = clockNow();
  source->startEncode("clip.mp4");
  const UINT64 afterStart = clockNow();
  ASSERT_EQ(encoders.size(), 1u);
  EXPECT_EQ(encoders[0]->path, "clip.mp4");
  ASSERT_NE(formatsGiven[0], nullptr);
  EXPECT_EQ(formatsGiven[0]->Format.nSamplesPerSec, 48000u);
  // A packet that began 10 ms before the start gives the clip only what follows the start.
  feed(floats(tone(960), beforeStart - 10 * kMs));
  feed(floats(tone(960), afterStart + 10 * kMs));
  std::this_thread::sleep_for(std::chrono::milliseconds(100));
  const UINT64 beforeStop = clockNow();
  source->stopEncode();
  const UINT64 afterStop = clockNow();
  feed(floats(tone(960), beforeStop - 10 * kMs));  // crosses the stop: cut there, and the clip ends
  feed(floats(tone(960), afterStop + 100 * kMs));
  std::lock_guard<std::mutex> lock(encoders[0]->mutex);
  ASSERT_EQ(encoders[0]->writes.size(), 3u);
  const auto& first = encoders[0]->writes[0];
  EXPECT_EQ(first.time, 0);
  EXPECT_LE(first.frames, 480u);
  EXPECT_GE(first.frames, 480u - (afterStart - beforeStart) / kFrame - 1);
  const auto& second = encoders[0]->writes[1];
  EXPECT_EQ(second.frames, 960u);
  EXPECT_GE(static_cast<UINT64>(second.time), 10 * kMs);
  EXPECT_LE(static_cast<UINT64>(second.time), 10 * kMs + (afterStart - beforeStart));
  const auto& last = encoders[0]->writes[2];
  EXPECT_GE(last.frames, 480u - 1);
  EXPECT_LE(last.frames, 480u + (afterStop - beforeStop) / kFrame + 1);
  EXPECT_EQ(encoders[0]->finalized, 1);
  EXPECT_TRUE(encoders[0]->deleted);
}

TEST_F(WasapiSource, ClipsWithoutAGapSplitAPacketBetweenThem) {
  startCapture();
  const UINT64 now = clockNow();
  source->startEncode("first.mp4");
  source->startEncode("second.mp4");  // ends the first where it begins
  const UINT64 later = clockNow();
  feed(floats(tone(960), now));
  {
    std::lock_guard<std::mutex> lock(encoders[0]->mutex);
    EXPECT_EQ(encoders[0]->finalized, 1);
  }
  std::lock_guard<std::mutex> lock(encoders[1]->mutex);
  ASSERT_EQ(encoders[1]->writes.size(), 1u);
  EXPECT_EQ(encoders[1]->writes[0].time, 0);
  uint64_t total = encoders[1]->writes[0].frames;
  {
    std::lock_guard<std::mutex> firstLock(encoders[0]->mutex);
    total += framesOf(*encoders[0]);
  }
  EXPECT_GE(total, 960u - (later - now) / kFrame - 2);  // nothing lost between the two
  EXPECT_LE(total, 960u);
  EXPECT_EQ(encoders[1]->finalized, 0);
}

// The endpoint delivers nothing more after the first clip's packet, and nothing at all in the
// second clip. Neither may stay open, and each lasts as long as it ran: the sound that never came
// is silence.
TEST_F(WasapiSource, AStoppedClipThatNoPacketReachesIsFinishedAnyway) {
  startCapture();
  const UINT64 firstStart = clockNow();
  source->startEncode("quiet.mp4");
  const UINT64 packetAt = clockNow();
  feed(floats(tone(480), packetAt));
  std::this_thread::sleep_for(std::chrono::milliseconds(40));
  const UINT64 secondStart = clockNow();
  source->startEncode("silent.mp4");
  const UINT64 secondStarted = clockNow();
  std::this_thread::sleep_for(std::chrono::milliseconds(50));
  const UINT64 secondStop = clockNow();
  source->stopEncode();
  const UINT64 afterStop = clockNow();
  ASSERT_TRUE(finished(0));
  ASSERT_TRUE(finished(1));
  const auto framesIn = [](UINT64 units) { return units * 48000 / 10000000; };
  {
    std::lock_guard<std::mutex> lock(encoders[0]->mutex);
    const auto& writes = encoders[0]->writes;
    EXPECT_EQ(writes.front().samples.front(), 0.25f);  // the packet, then silence
    EXPECT_TRUE(std::all_of(writes.begin() + 1, writes.end(), silent));
    const uint64_t first = framesOf(*encoders[0]);
    EXPECT_GE(first + 1, framesIn(secondStart - packetAt));  // the file begins with its first packet
    EXPECT_LE(first, framesIn(secondStarted - firstStart) + 1);
  }
  std::lock_guard<std::mutex> lock(encoders[1]->mutex);
  const auto& writes = encoders[1]->writes;
  EXPECT_EQ(writes.front().samples.front(), 0.0f);
  EXPECT_TRUE(std::all_of(writes.begin() + 1, writes.end(), silent));
  const uint64_t second = framesOf(*encoders[1]);
  EXPECT_GE(second + 1, framesIn(secondStop - secondStarted));
  EXPECT_LE(second, framesIn(afterStop - secondStart));
}

// A clip begun while the endpoint is away is silence until its first packet, or up to its stop
// when none comes, so it covers its time like any other.
TEST_F(WasapiSource, AClipBegunWhileTheEndpointIsAwayIsSilenceUntilItsFirstPacketOrItsStop) {
  startCapture();
  Output output;
  const int before = answered();
  audio->push(answer(AUDCLNT_E_DEVICE_INVALIDATED));
  audio->push(answer(AUDCLNT_E_DEVICE_INVALIDATED));  // away for two tries, back at the third
  ASSERT_TRUE(audio->waitAnswered(before + 1));
  const UINT64 awayStart = clockNow();
  source->startEncode("away.mp4");
  std::this_thread::sleep_for(std::chrono::milliseconds(100));
  source->stopEncode();
  const UINT64 awayStop = clockNow();
  source->startEncode("back.mp4");
  const UINT64 backStart = clockNow();
  ASSERT_TRUE(eventually([&] {
    std::lock_guard<std::mutex> lock(audio->mutex);
    return audio->activations >= 3 && audio->packets.empty();
  }));
  const UINT64 packetTime = clockNow();
  feed(floats(tone(480), packetTime));
  const UINT64 backStop = clockNow();
  source->stopEncode();
  feed(floats(tone(480), clockNow() + 100 * kMs));
  endCapture();
  output.lines();

  // The frames of the silent writes before the first sound, each timed where the one before ended.
  auto leadingSilence = [](const fakes::EncoderLog& log) {
    uint64_t frames = 0;
    for (const auto& write : log.writes) {
      if (!silent(write)) break;
      EXPECT_EQ(write.time, static_cast<int64_t>(frames * 10000000 / 48000));
      frames += write.frames;
    }
    return frames;
  };
  const auto framesIn = [](UINT64 units) { return static_cast<double>(units) * 48000 / 10000000; };
  ASSERT_EQ(encoders.size(), 2u);
  std::lock_guard<std::mutex> lockAway(encoders[0]->mutex);
  EXPECT_EQ(encoders[0]->finalized, 1);
  const uint64_t all = framesOf(*encoders[0]);
  EXPECT_EQ(leadingSilence(*encoders[0]), all) << "silence only";
  EXPECT_GE(all, 4800u - 1);
  EXPECT_LE(all, framesIn(awayStop - awayStart));
  std::lock_guard<std::mutex> lockBack(encoders[1]->mutex);
  EXPECT_EQ(encoders[1]->finalized, 1);
  const uint64_t silence = leadingSilence(*encoders[1]);
  EXPECT_GE(silence + 1, framesIn(packetTime - backStart));
  EXPECT_LE(silence, framesIn(packetTime - awayStop));
  // Then the packet, and silence up to the stop, which no packet reached.
  const auto& writes = encoders[1]->writes;
  const auto sound = std::find_if(writes.begin(), writes.end(),
                                  [](const auto& write) { return !write.samples.empty() && write.samples[0] != 0; });
  ASSERT_NE(sound, writes.end());
  EXPECT_EQ(sound->samples[0], 0.25f);
  EXPECT_GE(framesOf(*encoders[1]) + 2,
            framesIn(backStop - backStart));  // the two silences each rounded down to a frame
}

TEST_F(WasapiSource, SpecialAnswersOfGetBuffer) {
  startCapture();
  source->startEncode("clip.mp4");
  const UINT64 at = clockNow() + 10 * kMs;
  feed(answer(AUDCLNT_E_OUT_OF_ORDER));
  feed(answer(AUDCLNT_S_BUFFER_EMPTY));
  feed(floats({}, at));  // a zero-frame packet gives nothing to record
  fakes::Packet silent = floats({0.9f, 0.9f, 0.9f, 0.9f}, at, AUDCLNT_BUFFERFLAGS_SILENT);
  feed(silent);
  const uint8_t* original;
  {
    std::lock_guard<std::mutex> lock(audio->mutex);
    original = audio->handedOut;
    EXPECT_EQ(audio->captureReleases, (std::vector<UINT32>{0, 0, 0, 2}));
  }
  std::lock_guard<std::mutex> lock(encoders[0]->mutex);
  ASSERT_EQ(encoders[0]->writes.size(), 1u);
  EXPECT_EQ(encoders[0]->writes[0].frames, 2u);
  EXPECT_NE(encoders[0]->writes[0].data, original) << "a silent packet is handed on in a block of its own";
  EXPECT_EQ(encoders[0]->writes[0].samples, (std::vector<float>{0, 0, 0, 0})) << "and that block is silence";
}

TEST_F(WasapiSource, DiscontinuityAndTimestampErrorsWriteOnePositionLine) {
  startCapture();
  Output output;
  feed(floats({0.1f, 0.1f}, 12345, AUDCLNT_BUFFERFLAGS_DATA_DISCONTINUITY, 480));
  feed(floats({0.1f, 0.1f}, 23456, 0, 960));
  feed(floats({0.1f, 0.1f}, 34567, AUDCLNT_BUFFERFLAGS_TIMESTAMP_ERROR, 1440));
  std::vector<std::string> lines = output.lines();
  EXPECT_EQ(count(lines, "Dev Pos: "), 2);
  EXPECT_EQ(count(lines, "Dev Pos: 480\tClock Pos: 12345"), 1);
  EXPECT_EQ(count(lines, "Dev Pos: 1440\tClock Pos: 34567"), 1);
  std::lock_guard<std::mutex> lock(audio->mutex);
  EXPECT_EQ(audio->captureReleases, (std::vector<UINT32>{1, 1, 1}));
}

struct Failure {
  const char* name;
  HRESULT result;
  const char* text;
};
void PrintTo(const Failure& failure, std::ostream* out) { *out << failure.text; }

class WasapiSourceFailure : public WasapiSource, public testing::WithParamInterface<Failure> {};

TEST_P(WasapiSourceFailure, FinishesTheClipWarnsOnceSilencesTheMeterAndCapturesAgain) {
  startCapture();
  source->startPreview();
  source->startEncode("cut.mp4");
  feed(floats(tone(480), clockNow()));
  ASSERT_TRUE(eventually([&] { return source->peak(0) == 0.25; }));
  Output output;
  audio->push(answer(GetParam().result));
  audio->push(answer(GetParam().result));  // the same failure again on the next try
  // What was recorded up to the failure stays: the clip is finished.
  ASSERT_TRUE(finished(0));
  EXPECT_TRUE(eventually([&] { return source->peak(0) == 0.0 && source->peak(1) == 0.0; }))
      << "the meter still shows the sound of an endpoint that is away";
  // Half a second later the thread opens the endpoint again, by itself, twice.
  ASSERT_TRUE(eventually([&] {
    std::lock_guard<std::mutex> lock(audio->mutex);
    return audio->activations >= 3 && audio->packets.empty();
  }));
  std::this_thread::sleep_for(std::chrono::milliseconds(50));
  endCapture();
  std::vector<std::string> lines = output.lines();
  EXPECT_EQ(count(lines, ": Warning: "), 1) << "the same failure in a row is printed once";
  EXPECT_EQ(count(lines, GetParam().text), 1);
  std::lock_guard<std::mutex> lock(encoders[0]->mutex);
  EXPECT_EQ(encoders[0]->writes.size(), 1u);
}

INSTANTIATE_TEST_SUITE_P(
    Results, WasapiSourceFailure,
    testing::Values(
        Failure{"DeviceInvalidated", AUDCLNT_E_DEVICE_INVALIDATED,
                "native/capture/audio/wasapi/source(262): 0x88890004: Audio device is no longer valid for capture."},
        Failure{"BufferOperationPending", AUDCLNT_E_BUFFER_OPERATION_PENDING,
                "native/capture/audio/wasapi/source(264): 0x8889000b: Audio buffer operation is pending."},
        Failure{"ServiceNotRunning", AUDCLNT_E_SERVICE_NOT_RUNNING,
                "native/capture/audio/wasapi/source(266): 0x88890010: Audio client service is not running."}),
    [](const testing::TestParamInfo<Failure>& info) { return std::string(info.param.name); });

TEST_F(WasapiSource, UnreadableSamplesEndTheTryAfterTheEncoderHadThePacket) {
  script([&] {
    audio->mix.SubFormat = KSDATAFORMAT_SUBTYPE_PCM;
    audio->mix.Format.wBitsPerSample = 24;
    audio->mix.Format.nBlockAlign = 6;
  });
  startCapture();
  source->startPreview();
  source->startEncode("clip.mp4");
  Output output;
  fakes::Packet packet = floats({}, clockNow() + 10 * kMs);
  packet.bytes.assign(12, 0x10);
  packet.frames = 2;
  audio->push(packet);
  ASSERT_TRUE(finished(0));
  endCapture();
  const std::vector<std::string> lines = output.lines();
  EXPECT_EQ(count(lines, "Warning: native/capture/audio/wasapi/source(354): Peaks cannot be calculated"), 1)
      << testing::PrintToString(lines);
  std::lock_guard<std::mutex> lock(audio->mutex);
  EXPECT_TRUE(audio->captureReleases.empty()) << "the failing packet is not released";
  std::lock_guard<std::mutex> encoderLock(encoders[0]->mutex);
  EXPECT_EQ(encoders[0]->writes.size(), 1u);
}

}  // namespace
