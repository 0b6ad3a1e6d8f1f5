// The Linux sink writer: real files written through FFmpeg, read back with libavformat.
#include <gtest/gtest.h>

#include <algorithm>
#include <cstring>
#include <fstream>
#include <functional>
#include <iterator>
#include <random>
#include <ostream>
#include <string>
#include <vector>

#include "media.h"
#include "platform/mf.h"
#include "support.h"

namespace {

ComPtr<IMFSinkWriter> createWriter(const std::string& path, HRESULT* result = nullptr, bool mp4 = true) {
  ComPtr<IMFAttributes> attributes;
  MFCreateAttributes(&attributes, 0);
  attributes->SetUINT32(MF_LOW_LATENCY, TRUE);
  attributes->SetUINT32(MF_SINK_WRITER_DISABLE_THROTTLING, TRUE);
  if (mp4) attributes->SetGUID(MF_TRANSCODE_CONTAINERTYPE, MFTranscodeContainerType_MPEG4);
  ComPtr<IMFSinkWriter> writer;
  HRESULT hr = MFCreateSinkWriterFromURL(platform::widen(path).c_str(), nullptr, attributes.Get(), &writer);
  if (result) *result = hr;
  return writer;
}

ComPtr<IMFMediaType> h264Type(UINT32 width, UINT32 height, UINT32 profile = eAVEncH264VProfile_Main) {
  ComPtr<IMFMediaType> type;
  MFCreateMediaType(&type);
  type->SetGUID(MF_MT_MAJOR_TYPE, MFMediaType_Video);
  type->SetGUID(MF_MT_SUBTYPE, MFVideoFormat_H264);
  type->SetUINT32(MF_MT_AVG_BITRATE, 10485760);
  type->SetUINT32(MF_MT_INTERLACE_MODE, MFVideoInterlace_Progressive);
  MFSetAttributeSize(type.Get(), MF_MT_FRAME_SIZE, width, height);
  MFSetAttributeRatio(type.Get(), MF_MT_FRAME_RATE, 30, 1);
  MFSetAttributeRatio(type.Get(), MF_MT_PIXEL_ASPECT_RATIO, 1, 1);
  type->SetUINT32(MF_MT_MPEG2_PROFILE, profile);
  return type;
}

ComPtr<IMFMediaType> rgb32Type(UINT32 width, UINT32 height) {
  ComPtr<IMFMediaType> type;
  MFCreateMediaType(&type);
  type->SetGUID(MF_MT_MAJOR_TYPE, MFMediaType_Video);
  type->SetGUID(MF_MT_SUBTYPE, MFVideoFormat_RGB32);
  MFSetAttributeSize(type.Get(), MF_MT_FRAME_SIZE, width, height);
  MFSetAttributeRatio(type.Get(), MF_MT_FRAME_RATE, 30, 1);
  return type;
}

// A video writer of one H.264 stream fed with RGB32; input is adjusted by `adjust` if given.
ComPtr<IMFSinkWriter> videoWriter(const std::string& path, UINT32 width, UINT32 height, DWORD* stream,
                                  UINT32 profile = eAVEncH264VProfile_Main,
                                  const std::function<void(IMFMediaType*)>& adjust = nullptr) {
  ComPtr<IMFSinkWriter> writer = createWriter(path);
  if (!writer) return nullptr;
  ComPtr<IMFMediaType> out = h264Type(width, height, profile);
  EXPECT_EQ(writer->AddStream(out.Get(), stream), S_OK);
  ComPtr<IMFMediaType> in = rgb32Type(width, height);
  if (adjust) adjust(in.Get());
  EXPECT_EQ(writer->SetInputMediaType(*stream, in.Get(), nullptr), S_OK);
  EXPECT_EQ(writer->BeginWriting(), S_OK);
  return writer;
}

// The length the header gives the movie's fragments (mehd), in seconds of the movie header's time
// scale; -1 without one. Browsers show a fragmented file as long as this before they have read it.
double fragmentsLength(const std::string& path) {
  std::ifstream in(path, std::ios::binary);
  const std::string bytes((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
  const size_t mvhd = bytes.find("mvhd"), mehd = bytes.find("mehd");
  if (mvhd == std::string::npos || mehd == std::string::npos || mehd + 16 > bytes.size()) return -1;
  auto read = [&](size_t at, int count) {
    uint64_t value = 0;
    for (int i = 0; i < count; ++i) value = value << 8 | static_cast<uint8_t>(bytes[at + i]);
    return value;
  };
  const uint64_t timescale = read(mvhd + (bytes[mvhd + 4] == 1 ? 24 : 16), 4);
  const uint64_t length = bytes[mehd + 4] == 1 ? read(mehd + 8, 8) : read(mehd + 8, 4);
  return timescale ? static_cast<double>(length) / static_cast<double>(timescale) : -1;
}

ComPtr<IMFSample> sampleOf(const void* bytes, DWORD length, LONGLONG time, LONGLONG duration, bool timed = true) {
  ComPtr<IMFMediaBuffer> buffer;
  MFCreateMemoryBuffer(length, &buffer);
  BYTE* data = nullptr;
  buffer->Lock(&data, nullptr, nullptr);
  if (length) std::memcpy(data, bytes, length);
  buffer->Unlock();
  buffer->SetCurrentLength(length);
  ComPtr<IMFSample> sample;
  MFCreateSample(&sample);
  sample->AddBuffer(buffer.Get());
  if (timed) sample->SetSampleTime(time);
  if (duration >= 0) sample->SetSampleDuration(duration);
  return sample;
}

HRESULT writeBytes(const ComPtr<IMFSinkWriter>& writer, DWORD stream, const std::vector<uint8_t>& bytes, LONGLONG time,
                   LONGLONG duration, bool timed = true) {
  return writer->WriteSample(stream,
                             sampleOf(bytes.data(), static_cast<DWORD>(bytes.size()), time, duration, timed).Get());
}

// B, G, R, X rows in memory order; `bottomUp` stores the last picture row first.
std::vector<uint8_t> bands(int width, int height, bool bottomUp) {
  std::vector<uint8_t> pixels(static_cast<size_t>(width) * height * 4);
  for (int y = 0; y < height; ++y) {
    const int pictureRow = bottomUp ? height - 1 - y : y;
    const bool top = pictureRow < height / 2;
    for (int x = 0; x < width; ++x) {
      uint8_t* p = &pixels[(static_cast<size_t>(y) * width + x) * 4];
      p[0] = top ? 0 : 255;  // blue below
      p[1] = 0;
      p[2] = top ? 255 : 0;  // red above
      p[3] = 0;
    }
  }
  return pixels;
}

// Which of red or blue a decoded BGRA pixel is closest to: 'r', 'b' or '?'.
char colourAt(const media::Decoded& decoded, int x, int y) {
  const uint8_t* p = &decoded.firstPicture[(static_cast<size_t>(y) * decoded.width + x) * 4];
  if (p[2] > 180 && p[0] < 80 && p[1] < 80) return 'r';
  if (p[0] > 180 && p[2] < 80 && p[1] < 80) return 'b';
  return '?';
}

// Every test of the writer runs with Media Foundation started and a folder of its own.
class SinkWriter : public testing::Test {
 protected:
  media::MediaFoundation started;
  media::TempFolder folder;
};

TEST(MediaFoundationStartup, CountsStartupsAndRefusesUnpairedShutdownAndWriters) {
  while (SUCCEEDED(MFShutdown())) {
  }
  EXPECT_EQ(MFShutdown(), MF_E_PLATFORM_NOT_INITIALIZED);
  // A sink writer needs a started platform.
  media::TempFolder folder;
  HRESULT hr = S_OK;
  EXPECT_FALSE(createWriter(folder.file("a.mp4"), &hr));
  EXPECT_EQ(hr, MF_E_PLATFORM_NOT_INITIALIZED);
  EXPECT_EQ(MFStartup(0x10000, MFSTARTUP_FULL), MF_E_BAD_STARTUP_VERSION);
  EXPECT_EQ(MFStartup(MF_VERSION, MFSTARTUP_FULL), S_OK);
  EXPECT_EQ(MFStartup(MF_VERSION, MFSTARTUP_LITE), S_OK);
  EXPECT_EQ(MFShutdown(), S_OK);
  EXPECT_EQ(MFShutdown(), S_OK);
  EXPECT_EQ(MFShutdown(), MF_E_PLATFORM_NOT_INITIALIZED);
  EXPECT_EQ(MF_VERSION, 0x20070u);
}

TEST_F(SinkWriter, UnopenablePathsFailWithTheWindowsCodes) {
  HRESULT hr = S_OK;
  EXPECT_FALSE(createWriter(folder.file("missing/a.mp4"), &hr));
  EXPECT_EQ(hr, HRESULT_FROM_WIN32(ERROR_PATH_NOT_FOUND));
  EXPECT_EQ(static_cast<uint32_t>(hr), 0x80070003u);
  { std::ofstream(folder.file("plain")) << "x"; }
  EXPECT_FALSE(createWriter(folder.file("plain/a.mp4"), &hr));
  EXPECT_EQ(hr, HRESULT_FROM_WIN32(ERROR_PATH_NOT_FOUND));
  EXPECT_FALSE(createWriter(folder.path(), &hr));  // a folder is no file
  EXPECT_EQ(hr, HRESULT_FROM_WIN32(ERROR_ACCESS_DENIED));
  EXPECT_FALSE(createWriter(folder.file("no-container.xyz"), &hr, false));
  EXPECT_EQ(hr, MF_E_UNSUPPORTED_BYTESTREAM_TYPE);
}

TEST_F(SinkWriter, AFileAnotherWriterHoldsIsRefusedUntilItIsFinished) {
  const std::string path = folder.file("busy.mp4");
  DWORD stream = 0;
  ComPtr<IMFSinkWriter> first = videoWriter(path, 64, 64, &stream);
  ASSERT_TRUE(first);
  HRESULT hr = S_OK;
  EXPECT_FALSE(createWriter(path, &hr));
  EXPECT_EQ(hr, HRESULT_FROM_WIN32(ERROR_SHARING_VIOLATION));
  // The refused writer left the first one's file alone.
  const auto pixels = bands(64, 64, true);
  for (int i = 0; i < 3; ++i) ASSERT_EQ(writeBytes(first, stream, pixels, i * 333333LL, 333333), S_OK);
  ASSERT_EQ(first->Finalize(), S_OK);
  EXPECT_EQ(media::decode(path, AVMEDIA_TYPE_VIDEO).frames, 3);
  EXPECT_TRUE(createWriter(path, &hr));
  EXPECT_EQ(hr, S_OK);
}

TEST_F(SinkWriter, CreatesTheFileAtOnceAndTakesTheContainerFromTheAttribute) {
  // The extension says nothing; the attribute chooses MP4.
  const std::string path = folder.file("clip.unknown");
  DWORD stream = 0;
  ComPtr<IMFSinkWriter> writer = createWriter(path);
  ASSERT_TRUE(writer);
  EXPECT_TRUE(std::filesystem::exists(path));
  ComPtr<IMFMediaType> out = h264Type(64, 64);
  ASSERT_EQ(writer->AddStream(out.Get(), &stream), S_OK);
  ComPtr<IMFMediaType> in = rgb32Type(64, 64);
  ASSERT_EQ(writer->SetInputMediaType(stream, in.Get(), nullptr), S_OK);
  ASSERT_EQ(writer->BeginWriting(), S_OK);
  // From here on the file is an MP4 file with its stream, empty until the first fragment: a host
  // killed now leaves one.
  const media::File empty = media::probe(path);
  ASSERT_TRUE(empty.opened);
  ASSERT_EQ(empty.streams.size(), 1u);
  EXPECT_EQ(empty.streams[0].codec, "h264");
  EXPECT_EQ(empty.streams[0].packets.size(), 0u);
  const auto pixels = bands(64, 64, true);
  for (int i = 0; i < 3; ++i) EXPECT_EQ(writeBytes(writer, stream, pixels, i * 333333LL, 333333), S_OK);
  EXPECT_EQ(writer->Finalize(), S_OK);
  AVFormatContext* format = nullptr;
  ASSERT_EQ(avformat_open_input(&format, path.c_str(), nullptr, nullptr), 0);
  EXPECT_NE(std::string(format->iformat->name).find("mp4"), std::string::npos);
  avformat_close_input(&format);
}

TEST_F(SinkWriter, FileNamesOutsideTheBasicPlaneArriveAsUtf8) {
  const std::string path = folder.file("clip-\xF0\x9F\x8E\xA5-\xC3\xA9.mp4");  // camera emoji, e acute
  const std::wstring units = platform::widen(path);
  EXPECT_EQ(units.size(), folder.path().size() + 1 + 13);  // the emoji is a surrogate pair
  ComPtr<IMFAttributes> attributes;
  MFCreateAttributes(&attributes, 0);
  attributes->SetGUID(MF_TRANSCODE_CONTAINERTYPE, MFTranscodeContainerType_MPEG4);
  ComPtr<IMFSinkWriter> writer = nullptr;
  ASSERT_EQ(MFCreateSinkWriterFromURL(units.c_str(), nullptr, attributes.Get(), &writer), S_OK);
  EXPECT_TRUE(std::filesystem::exists(std::filesystem::u8path(path)));
}

TEST_F(SinkWriter, H264IsReallyMainWithTheTypesSizeRateAndBitRate) {
  const std::string path = folder.file("noise.mp4");
  const UINT32 width = 640, height = 360;
  DWORD stream = 99;
  ComPtr<IMFSinkWriter> writer = videoWriter(path, width, height, &stream);
  ASSERT_TRUE(writer);
  EXPECT_EQ(stream, 0u);
  // Noise needs far more than the bit rate, so the encoder has to hold it at its target.
  std::mt19937 random(7);
  std::vector<uint8_t> pixels(width * height * 4);
  const int frames = 90;
  for (int i = 0; i < frames; ++i) {
    for (auto& byte : pixels) byte = static_cast<uint8_t>(random());
    ASSERT_EQ(writeBytes(writer, stream, pixels, i * 10000000LL / 30, 333333), S_OK);
  }
  EXPECT_EQ(writer->Finalize(), S_OK);

  const media::File file = media::probe(path);
  ASSERT_TRUE(file.opened);
  ASSERT_EQ(file.streams.size(), 1u);
  const media::Stream& video = file.streams[0];
  EXPECT_EQ(video.codec, "h264");
  EXPECT_EQ(video.profile, FF_PROFILE_H264_MAIN);
  EXPECT_EQ(video.width, 640);
  EXPECT_EQ(video.height, 360);
  EXPECT_EQ(av_cmp_q(video.rFrameRate, AVRational{30, 1}), 0) << video.rFrameRate.num << "/" << video.rFrameRate.den;
  EXPECT_EQ(av_cmp_q(video.avgFrameRate, AVRational{30, 1}), 0)
      << video.avgFrameRate.num << "/" << video.avgFrameRate.den;
  ASSERT_EQ(video.packets.size(), static_cast<size_t>(frames));
  const double seconds = frames / 30.0;
  const double bitsPerSecond = video.bytes * 8 / seconds;
  EXPECT_NEAR(bitsPerSecond, 10485760, 10485760 * 0.15);
  EXPECT_NEAR(file.duration, seconds, 0.001);  // packet durations set: not one frame short
  EXPECT_NEAR(fragmentsLength(path), seconds, 0.001);

  const media::Decoded decoded = media::decode(path, AVMEDIA_TYPE_VIDEO);
  EXPECT_EQ(decoded.errors, 0);
  EXPECT_EQ(decoded.frames, frames);
}

// Red above blue in I420 (BT.709, limited range), as the camera engine hands its pictures on.
std::vector<uint8_t> i420Bands(int width, int height) {
  std::vector<uint8_t> planes(static_cast<size_t>(width) * height * 3 / 2);
  uint8_t* u = &planes[static_cast<size_t>(width) * height];
  uint8_t* v = u + static_cast<size_t>(width / 2) * (height / 2);
  for (int y = 0; y < height; ++y) {
    const bool top = y < height / 2;
    std::fill_n(&planes[static_cast<size_t>(y) * width], width, top ? 63 : 32);
    if (y % 2) continue;
    std::fill_n(u + static_cast<size_t>(y / 2) * (width / 2), width / 2, top ? 102 : 240);
    std::fill_n(v + static_cast<size_t>(y / 2) * (width / 2), width / 2, top ? 240 : 118);
  }
  return planes;
}

// How the input pictures lie in memory, and the profile asked for.
struct PictureCase {
  const char* name;
  GUID subtype;
  UINT32 stride;  // MF_MT_DEFAULT_STRIDE; 0: not set
  UINT32 profile;
  int expectedProfile;  // without the constrained flag
};
void PrintTo(const PictureCase& c, std::ostream* out) { *out << c.name; }

class PictureLayout : public SinkWriter, public testing::WithParamInterface<PictureCase> {};

TEST_P(PictureLayout, DecodesUprightWithTheProfileAskedFor) {
  const PictureCase c = GetParam();
  const std::string path = folder.file("layout.mp4");
  DWORD stream = 0;
  ComPtr<IMFSinkWriter> writer = videoWriter(path, 160, 120, &stream, c.profile, [&](IMFMediaType* in) {
    in->SetGUID(MF_MT_SUBTYPE, c.subtype);
    if (c.stride) in->SetUINT32(MF_MT_DEFAULT_STRIDE, c.stride);
  });
  ASSERT_TRUE(writer);
  // RGB32 without a stride is bottom-up.
  const auto pixels = c.subtype == MFVideoFormat_I420 ? i420Bands(160, 120) : bands(160, 120, c.stride == 0);
  for (int i = 0; i < 3; ++i) ASSERT_EQ(writeBytes(writer, stream, pixels, i * 333333LL, 333333), S_OK);
  ASSERT_EQ(writer->Finalize(), S_OK);
  const media::File file = media::probe(path);
  ASSERT_TRUE(file.opened);
  EXPECT_EQ(file.streams[0].profile & ~FF_PROFILE_H264_CONSTRAINED, c.expectedProfile);
  const media::Decoded decoded = media::decode(path, AVMEDIA_TYPE_VIDEO);
  ASSERT_EQ(decoded.width, 160);
  EXPECT_EQ(colourAt(decoded, 80, 10), 'r');
  EXPECT_EQ(colourAt(decoded, 80, 110), 'b');
}

INSTANTIATE_TEST_SUITE_P(Inputs, PictureLayout,
                         testing::Values(PictureCase{"Rgb32WithoutStrideIsBottomUp", MFVideoFormat_RGB32, 0,
                                                     eAVEncH264VProfile_Main, FF_PROFILE_H264_MAIN},
                                         PictureCase{"Rgb32PositiveStrideIsTopDown", MFVideoFormat_RGB32, 160 * 4,
                                                     eAVEncH264VProfile_Main, FF_PROFILE_H264_MAIN},
                                         PictureCase{"BaselineWhenAsked", MFVideoFormat_RGB32, 0,
                                                     eAVEncH264VProfile_Base, FF_PROFILE_H264_BASELINE},
                                         PictureCase{"I420AsItIs", MFVideoFormat_I420, 160, eAVEncH264VProfile_Base,
                                                     FF_PROFILE_H264_BASELINE}),
                         [](const testing::TestParamInfo<PictureCase>& info) { return std::string(info.param.name); });

// libx264 takes no odd sizes: a red display picture whose last column and row are blue.
TEST_F(SinkWriter, OddPicturesAreEncodedAtTheNextEvenSizeWithTheirLastColumnAndRowRepeated) {
  const int width = 161, height = 121;
  const std::string path = folder.file("odd.mp4");
  DWORD stream = 0;
  ComPtr<IMFSinkWriter> writer = videoWriter(path, width, height, &stream);
  ASSERT_TRUE(writer);
  std::vector<uint8_t> pixels(static_cast<size_t>(width) * height * 4);
  for (int y = 0; y < height; ++y)
    for (int x = 0; x < width; ++x) {
      const bool edge = x == width - 1 || y == 0;        // bottom-up: the first row in memory is the last
      pixels[(y * width + x) * 4] = edge ? 255 : 0;      // blue
      pixels[(y * width + x) * 4 + 2] = edge ? 0 : 255;  // red
    }
  for (int i = 0; i < 3; ++i) ASSERT_EQ(writeBytes(writer, stream, pixels, i * 333333LL, 333333), S_OK);
  ASSERT_EQ(writer->Finalize(), S_OK);
  const media::Decoded decoded = media::decode(path, AVMEDIA_TYPE_VIDEO);
  ASSERT_EQ(decoded.frames, 3);
  ASSERT_EQ(decoded.width, 162);
  ASSERT_EQ(decoded.firstPicture.size(), 162u * 122 * 4);
  const auto at = [&](int x, int y) { return colourAt(decoded, x, y); };
  EXPECT_EQ(std::string() + at(80, 60) + at(158, 60) + at(160, 60) + at(161, 60), "rrbb");    // along a row
  EXPECT_EQ(std::string() + at(80, 118) + at(80, 120) + at(80, 121) + at(161, 121), "rbbb");  // down, the corner
}

TEST_F(SinkWriter, SampleTimesAndDurationsBecomePacketTimes) {
  const std::string path = folder.file("times.mp4");
  DWORD stream = 0;
  ComPtr<IMFSinkWriter> writer = videoWriter(path, 64, 64, &stream);
  ASSERT_TRUE(writer);
  const auto pixels = bands(64, 64, true);
  for (LONGLONG time : {0, 330000, 1000000}) ASSERT_EQ(writeBytes(writer, stream, pixels, time, 166666), S_OK);
  // Without a time a sample follows the previous one; without a duration it lasts one frame.
  ASSERT_EQ(writeBytes(writer, stream, pixels, 0, -1, false), S_OK);
  ASSERT_EQ(writeBytes(writer, stream, pixels, 0, -1, false), S_OK);
  ASSERT_EQ(writer->Finalize(), S_OK);
  const media::File file = media::probe(path);
  ASSERT_TRUE(file.opened);
  const auto& packets = file.streams[0].packets;
  ASSERT_EQ(packets.size(), 5u);
  const double times[] = {0.0, 0.033, 0.100, 0.1166666, 0.15};
  for (size_t i = 0; i < packets.size(); ++i) EXPECT_NEAR(packets[i].time, times[i], 1e-4) << "packet " << i;
  EXPECT_TRUE(packets[0].key);
  EXPECT_NEAR(file.duration, 0.15 + 1 / 30.0, 1e-3);
}

TEST_F(SinkWriter, RefusesCallsOutOfOrder) {
  ComPtr<IMFSinkWriter> writer = createWriter(folder.file("order.mp4"));
  ASSERT_TRUE(writer);
  std::vector<uint8_t> pixels(64 * 64 * 4);
  EXPECT_EQ(writer->BeginWriting(), MF_E_INVALIDREQUEST);  // no stream
  DWORD stream = 0;
  ComPtr<IMFMediaType> out = h264Type(64, 64);
  ASSERT_EQ(writer->AddStream(out.Get(), &stream), S_OK);
  EXPECT_EQ(writeBytes(writer, stream, pixels, 0, 1), MF_E_INVALIDREQUEST);
  EXPECT_EQ(writer->BeginWriting(), MF_E_TRANSFORM_TYPE_NOT_SET);
  ComPtr<IMFMediaType> in = rgb32Type(64, 64);
  EXPECT_EQ(writer->SetInputMediaType(5, in.Get(), nullptr), MF_E_INVALIDSTREAMNUMBER);
  ASSERT_EQ(writer->SetInputMediaType(stream, in.Get(), nullptr), S_OK);
  ASSERT_EQ(writer->BeginWriting(), S_OK);
  EXPECT_EQ(writer->AddStream(out.Get(), &stream), MF_E_INVALIDREQUEST);
  EXPECT_EQ(writer->SetInputMediaType(stream, in.Get(), nullptr), MF_E_INVALIDREQUEST);
  EXPECT_EQ(writeBytes(writer, 3, pixels, 0, 1), MF_E_INVALIDSTREAMNUMBER);
  EXPECT_EQ(writeBytes(writer, stream, std::vector<uint8_t>(100), 0, 1), MF_E_BUFFERTOOSMALL);
  EXPECT_EQ(writeBytes(writer, stream, pixels, 0, 333333), S_OK);
  EXPECT_EQ(writer->Finalize(), S_OK);
  EXPECT_EQ(writer->Finalize(), MF_E_INVALIDREQUEST);
  EXPECT_EQ(writeBytes(writer, stream, pixels, 0, 1), MF_E_INVALIDREQUEST);
}

TEST_F(SinkWriter, RefusesTypesItCannotWrite) {
  ComPtr<IMFSinkWriter> writer = createWriter(folder.file("types.mp4"));
  ASSERT_TRUE(writer);
  DWORD stream = 0;
  ComPtr<IMFMediaType> mjpg = h264Type(64, 64);
  mjpg->SetGUID(MF_MT_SUBTYPE, MFVideoFormat_MJPG);
  EXPECT_EQ(writer->AddStream(mjpg.Get(), &stream), MF_E_INVALIDMEDIATYPE);
  ComPtr<IMFMediaType> sizeless = h264Type(64, 64);
  sizeless->DeleteItem(MF_MT_FRAME_SIZE);
  EXPECT_EQ(writer->AddStream(sizeless.Get(), &stream), MF_E_INVALIDMEDIATYPE);
  ComPtr<IMFMediaType> out = h264Type(64, 64);
  ASSERT_EQ(writer->AddStream(out.Get(), &stream), S_OK);
  ComPtr<IMFMediaType> in = rgb32Type(64, 64);
  in->SetGUID(MF_MT_SUBTYPE, MFVideoFormat_MJPG);
  EXPECT_EQ(writer->SetInputMediaType(stream, in.Get(), nullptr), MF_E_INVALIDMEDIATYPE);
  in->SetGUID(MF_MT_MAJOR_TYPE, MFMediaType_Audio);
  EXPECT_EQ(writer->SetInputMediaType(stream, in.Get(), nullptr), MF_E_INVALIDMEDIATYPE);
  // H.264 input is copied, and a copy cannot scale: it must have the output's size.
  ComPtr<IMFMediaType> h264 = h264Type(32, 32);
  EXPECT_EQ(writer->SetInputMediaType(stream, h264.Get(), nullptr), MF_E_INVALIDMEDIATYPE);
  MFSetAttributeSize(h264.Get(), MF_MT_FRAME_SIZE, 64, 64);
  EXPECT_EQ(writer->SetInputMediaType(stream, h264.Get(), nullptr), S_OK);
}

TEST_F(SinkWriter, FinalizeWithoutSamplesFails) {
  DWORD stream = 0;
  ComPtr<IMFSinkWriter> writer = videoWriter(folder.file("empty.mp4"), 64, 64, &stream);
  ASSERT_TRUE(writer);
  EXPECT_EQ(writer->Finalize(), MF_E_SINK_NO_SAMPLES_PROCESSED);
}

// ---- H.264 input: copied, not encoded ----

// Writes a camera stream through a writer whose input type is H.264; the sequence header is
// given on the input type when `withHeader`.
HRESULT copyStream(const std::string& path, const media::CameraStream& camera, int width, int height, bool withHeader) {
  ComPtr<IMFSinkWriter> writer = createWriter(path);
  if (!writer) return E_FAIL;
  DWORD stream = 0;
  ComPtr<IMFMediaType> out = h264Type(width, height);
  HRESULT hr = writer->AddStream(out.Get(), &stream);
  ComPtr<IMFMediaType> in = h264Type(width, height);
  in->DeleteItem(MF_MT_AVG_BITRATE);
  if (withHeader)
    in->SetBlob(MF_MT_MPEG_SEQUENCE_HEADER, camera.header.data(), static_cast<UINT32>(camera.header.size()));
  if (SUCCEEDED(hr)) hr = writer->SetInputMediaType(stream, in.Get(), nullptr);
  if (SUCCEEDED(hr)) hr = writer->BeginWriting();
  for (size_t i = 0; SUCCEEDED(hr) && i < camera.packets.size(); ++i) {
    const auto& bytes = camera.packets[i];
    ComPtr<IMFSample> sample = sampleOf(bytes.data(), static_cast<DWORD>(bytes.size()), i * 10000000LL / 30, 333333);
    if (camera.keys[i]) sample->SetUINT32(MFSampleExtension_CleanPoint, TRUE);
    hr = writer->WriteSample(stream, sample.Get());
  }
  if (SUCCEEDED(hr)) hr = writer->Finalize();
  return hr;
}

// The file holds the camera's own stream: its profile (High, where the writer's output type
// asks for Main), its key frames, its times and pictures.
void expectCameraStreamIn(const std::string& path, const media::CameraStream& camera) {
  const media::File file = media::probe(path);
  ASSERT_TRUE(file.opened);
  ASSERT_EQ(file.streams.size(), 1u);
  const media::Stream& video = file.streams[0];
  EXPECT_EQ(video.codec, "h264");
  EXPECT_EQ(video.profile, FF_PROFILE_H264_HIGH);
  EXPECT_EQ(video.width, 160);
  EXPECT_EQ(video.height, 120);
  ASSERT_EQ(video.packets.size(), camera.packets.size());
  for (size_t i = 0; i < video.packets.size(); ++i)
    EXPECT_NEAR(video.packets[i].time, i / 30.0, 1e-4) << "packet " << i;
  EXPECT_EQ(media::containerKeys(path), camera.keys);  // the file's own sync samples, from the clean points
  EXPECT_NEAR(file.duration, camera.packets.size() / 30.0, 1e-3);
  // The decoder needs the parameter sets from the file's avcC or the packets: no errors, every frame.
  const media::Decoded decoded = media::decode(path, AVMEDIA_TYPE_VIDEO);
  EXPECT_EQ(decoded.errors, 0);
  EXPECT_EQ(decoded.frames, static_cast<int>(camera.packets.size()));
  ASSERT_EQ(decoded.width, 160);
  EXPECT_EQ(colourAt(decoded, 80, 20), 'r');
  EXPECT_EQ(colourAt(decoded, 80, 100), 'b');
}

// With a sequence header on the input type, or without one: then the first key frame's parameter
// sets serve.
TEST_F(SinkWriter, H264InputIsCopiedWithOrWithoutTheSequenceHeaderOfItsType) {
  for (bool withHeader : {true, false}) {
    SCOPED_TRACE(withHeader ? "sequence header" : "parameter sets in the packets");
    const media::CameraStream camera = media::cameraStream(160, 120, 45, 15, withHeader);
    ASSERT_EQ(camera.packets.size(), 45u);
    ASSERT_EQ(camera.header.empty(), !withHeader);
    ASSERT_EQ(std::count(camera.keys.begin(), camera.keys.end(), true), 3);
    const std::string path = folder.file(withHeader ? "copy.mp4" : "inband.mp4");
    ASSERT_EQ(copyStream(path, camera, 160, 120, withHeader), S_OK);
    expectCameraStreamIn(path, camera);
  }
}

// ---- AAC ----

ComPtr<IMFMediaType> aacType(UINT32 rate, UINT32 channels, UINT32 bytesPerSecond = 24000) {
  ComPtr<IMFMediaType> type;
  MFCreateMediaType(&type);
  type->SetGUID(MF_MT_MAJOR_TYPE, MFMediaType_Audio);
  type->SetGUID(MF_MT_SUBTYPE, MFAudioFormat_AAC);
  type->SetUINT32(MF_MT_AUDIO_BITS_PER_SAMPLE, 16);
  type->SetUINT32(MF_MT_AUDIO_SAMPLES_PER_SECOND, rate);
  type->SetUINT32(MF_MT_AUDIO_NUM_CHANNELS, channels);
  type->SetUINT32(MF_MT_AUDIO_AVG_BYTES_PER_SECOND, bytesPerSecond);
  return type;
}

ComPtr<IMFSinkWriter> audioWriter(const std::string& path, UINT32 rate, UINT32 channels, WORD tag, WORD bits,
                                  DWORD mask, DWORD* stream) {
  ComPtr<IMFSinkWriter> writer = createWriter(path);
  if (!writer) return nullptr;
  ComPtr<IMFMediaType> out = aacType(rate, channels);
  EXPECT_EQ(writer->AddStream(out.Get(), stream), S_OK);
  WAVEFORMATEX format{};
  format.wFormatTag = tag;
  format.nChannels = static_cast<WORD>(channels);
  format.nSamplesPerSec = rate;
  format.wBitsPerSample = bits;
  format.nBlockAlign = static_cast<WORD>(channels * bits / 8);
  format.nAvgBytesPerSec = rate * format.nBlockAlign;
  ComPtr<IMFMediaType> in;
  MFCreateMediaType(&in);
  EXPECT_EQ(MFInitMediaTypeFromWaveFormatEx(in.Get(), &format, sizeof format), S_OK);
  if (mask) in->SetUINT32(MF_MT_AUDIO_CHANNEL_MASK, mask);
  EXPECT_EQ(writer->SetInputMediaType(*stream, in.Get(), nullptr), S_OK);
  EXPECT_EQ(writer->BeginWriting(), S_OK);
  return writer;
}

// A sine of `frequency` at amplitude 0.5 in every channel, as bytes of the given sample kind.
std::vector<uint8_t> sine(double frequency, UINT32 rate, UINT32 channels, WORD tag, WORD bits, int64_t first,
                          int frames) {
  std::vector<uint8_t> bytes(static_cast<size_t>(frames) * channels * bits / 8);
  uint8_t* out = bytes.data();
  for (int f = 0; f < frames; ++f) {
    const double value = 0.5 * std::sin(2 * M_PI * frequency * (first + f) / rate);
    for (UINT32 c = 0; c < channels; ++c) {
      if (tag == WAVE_FORMAT_IEEE_FLOAT) {
        const float v = static_cast<float>(value);
        std::memcpy(out, &v, 4);
      } else {
        const int32_t v = static_cast<int32_t>(std::lround(value * ((1LL << (bits - 1)) - 1)));
        std::memcpy(out, &v, bits / 8);  // little-endian: the low bytes
      }
      out += bits / 8;
    }
  }
  return bytes;
}

struct AudioCase {
  const char* name;
  UINT32 rate;
  UINT32 channels;
  WORD tag;
  WORD bits;
  DWORD mask;
  UINT32 fileRate = 0;  // the file's rate when AAC does not take the input's
  bool mixed = false;   // channels mixed into another layout: the tone is there, at some level
};
void PrintTo(const AudioCase& c, std::ostream* out) { *out << c.name; }

class AacFile : public SinkWriter, public testing::WithParamInterface<AudioCase> {};

TEST_P(AacFile, KeepsRateChannelsDurationAndTheTone) {
  const AudioCase c = GetParam();
  const std::string path = folder.file("tone.mp4");
  DWORD stream = 0;
  ComPtr<IMFSinkWriter> writer = audioWriter(path, c.rate, c.channels, c.tag, c.bits, c.mask, &stream);
  ASSERT_TRUE(writer);
  const int packet = static_cast<int>(c.rate / 100);  // 10 ms packets for 2 s
  for (int i = 0; i < 200; ++i) {
    const auto bytes = sine(440, c.rate, c.channels, c.tag, c.bits, int64_t(i) * packet, packet);
    // The first packet carries no time, the rest the time of their first sample.
    ASSERT_EQ(writeBytes(writer, stream, bytes, i * 100000LL, 0, i != 0), S_OK);
  }
  ASSERT_EQ(writer->Finalize(), S_OK);

  const int rate = static_cast<int>(c.fileRate ? c.fileRate : c.rate);
  const media::File file = media::probe(path);
  ASSERT_TRUE(file.opened);
  ASSERT_EQ(file.streams.size(), 1u);
  EXPECT_EQ(file.streams[0].codec, "aac");
  EXPECT_EQ(file.streams[0].sampleRate, rate);
  EXPECT_EQ(file.streams[0].channels, static_cast<int>(c.channels));
  EXPECT_NEAR(file.duration, 2.0, 2.0 * 0.03);
  const double bitsPerSecond = file.streams[0].bytes * 8 / 2.0;
  EXPECT_LT(bitsPerSecond, 192000 * 1.2);

  const media::Decoded decoded = media::decode(path, AVMEDIA_TYPE_AUDIO);
  EXPECT_EQ(decoded.errors, 0);
  ASSERT_EQ(decoded.channels, static_cast<int>(c.channels));
  for (int ch = 0; ch < decoded.channels; ++ch) {
    if (decoded.channels == 6 && ch == 3) continue;  // the LFE channel is low-passed by design
    std::vector<float> mono = media::channel(decoded.samples, decoded.channels, ch);
    ASSERT_GT(mono.size(), static_cast<size_t>(rate));
    mono.assign(mono.begin() + rate / 2, mono.begin() + rate / 2 + rate);  // one second from the middle
    const double tone = media::power(mono, 440, rate);
    if (c.mixed)
      EXPECT_GT(std::sqrt(tone) * 2, 0.1) << "channel " << ch;
    else
      EXPECT_NEAR(std::sqrt(tone) * 2, 0.5, 0.05) << "channel " << ch;  // the amplitude comes back
    for (double other : {220.0, 660.0, 1000.0, 3000.0})
      EXPECT_LT(media::power(mono, other, rate), tone / 1000) << other << " Hz, channel " << ch;
  }
}

INSTANTIATE_TEST_SUITE_P(
    SampleKinds, AacFile,
    testing::Values(
        AudioCase{"Float48kStereo", 48000, 2, WAVE_FORMAT_IEEE_FLOAT, 32, SPEAKER_FRONT_LEFT | SPEAKER_FRONT_RIGHT},
        AudioCase{"Pcm16At44kMono", 44100, 1, WAVE_FORMAT_PCM, 16, SPEAKER_FRONT_CENTER},
        AudioCase{"Pcm24Stereo", 48000, 2, WAVE_FORMAT_PCM, 24, 0},
        AudioCase{"Pcm32Stereo", 48000, 2, WAVE_FORMAT_PCM, 32, 0},
        AudioCase{"Float5_1", 48000, 6, WAVE_FORMAT_IEEE_FLOAT, 32, 0x3F},
        AudioCase{"Float5_1WithSideSpeakers", 48000, 6, WAVE_FORMAT_IEEE_FLOAT, 32, 0x60F},
        AudioCase{"Pcm16At192kIsWrittenAt96k", 192000, 2, WAVE_FORMAT_PCM, 16, 3, 96000},
        // PulseAudio's own map for six channels: FL FR FC FLC FRC BC.
        AudioCase{"Float6ChannelsOfNoAacLayoutAreMixedInto5_1", 48000, 6, WAVE_FORMAT_IEEE_FLOAT, 32, 0x1C7, 0, true}),
    [](const testing::TestParamInfo<AudioCase>& info) { return std::string(info.param.name); });

TEST_F(SinkWriter, AudioGapsInSampleTimesBecomeSilence) {
  const std::string path = folder.file("gap.mp4");
  DWORD stream = 0;
  ComPtr<IMFSinkWriter> writer = audioWriter(path, 48000, 2, WAVE_FORMAT_IEEE_FLOAT, 32, 3, &stream);
  ASSERT_TRUE(writer);
  // One second, then one more second stamped to start at 2 s.
  for (int i = 0; i < 200; ++i) {
    const LONGLONG time = (i < 100 ? i : i + 100) * 100000LL;
    const auto bytes = sine(440, 48000, 2, WAVE_FORMAT_IEEE_FLOAT, 32, int64_t(i) * 480, 480);
    ASSERT_EQ(writeBytes(writer, stream, bytes, time, 0, i != 0), S_OK);
  }
  ASSERT_EQ(writer->Finalize(), S_OK);
  const media::File file = media::probe(path);
  EXPECT_NEAR(file.duration, 3.0, 0.05);
  const media::Decoded decoded = media::decode(path, AVMEDIA_TYPE_AUDIO);
  std::vector<float> left = media::channel(decoded.samples, 2, 0);
  ASSERT_GT(left.size(), 48000u * 2);
  std::vector<float> gap(left.begin() + 48000 + 9600, left.begin() + 2 * 48000 - 9600);
  double energy = 0;
  for (float x : gap) energy += x * x;
  EXPECT_LT(energy / gap.size(), 1e-6);
}

// ---- attribute stores, media types, buffers, samples, collections ----

TEST(Attributes, StoreTypedValuesAndAnswerWithMediaFoundationCodes) {
  ComPtr<IMFAttributes> attributes;
  ASSERT_EQ(MFCreateAttributes(&attributes, 4), S_OK);
  const GUID key = MF_MT_AVG_BITRATE;
  UINT32 u32 = 0;
  UINT64 u64 = 0;
  EXPECT_EQ(attributes->GetUINT32(key, &u32), MF_E_ATTRIBUTENOTFOUND);
  EXPECT_EQ(attributes->SetUINT32(key, 7), S_OK);
  EXPECT_EQ(attributes->GetUINT64(key, &u64), MF_E_INVALIDTYPE);
  EXPECT_EQ(attributes->SetUINT32(key, 9), S_OK);  // replaces
  EXPECT_EQ(attributes->GetUINT32(key, &u32), S_OK);
  EXPECT_EQ(u32, 9u);
  const UINT8 blob[3] = {1, 2, 3};
  EXPECT_EQ(attributes->SetBlob(MF_MT_MPEG_SEQUENCE_HEADER, blob, 3), S_OK);
  UINT8 small[2];
  EXPECT_EQ(attributes->GetBlob(MF_MT_MPEG_SEQUENCE_HEADER, small, 2, nullptr), HRESULT_FROM_WIN32(122));
  EXPECT_EQ(attributes->SetString(MF_MT_USER_DATA, L"name"), S_OK);

  ComPtr<IMFAttributes> copied;
  MFCreateAttributes(&copied, 0);
  copied->SetUINT32(MF_MT_INTERLACE_MODE, 2);  // replaced by the copy
  EXPECT_EQ(attributes->CopyAllItems(copied.Get()), S_OK);
  UINT32 count = 0;
  copied->GetCount(&count);
  EXPECT_EQ(count, 3u);
  EXPECT_EQ(copied->GetUINT32(MF_MT_INTERLACE_MODE, &u32), MF_E_ATTRIBUTENOTFOUND);
  UINT8 back[3] = {};
  EXPECT_EQ(copied->GetBlob(MF_MT_MPEG_SEQUENCE_HEADER, back, 3, nullptr), S_OK);
  EXPECT_EQ(back[2], 3);
  LPWSTR text = nullptr;
  EXPECT_EQ(copied->GetAllocatedString(MF_MT_USER_DATA, &text, &count), S_OK);
  EXPECT_EQ(std::wstring(text), L"name");
  CoTaskMemFree(text);
}

TEST(Attributes, MediaTypeFromWaveFormat) {
  WAVEFORMATEXTENSIBLE format = testsupport::waveFormat(2, 48000, 32, KSDATAFORMAT_SUBTYPE_IEEE_FLOAT, 3);
  ComPtr<IMFMediaType> type;
  MFCreateMediaType(&type);
  EXPECT_EQ(MFInitMediaTypeFromWaveFormatEx(type.Get(), &format.Format, 18), E_INVALIDARG);
  ASSERT_EQ(MFInitMediaTypeFromWaveFormatEx(type.Get(), &format.Format, sizeof format), S_OK);
  GUID subtype;
  type->GetGUID(MF_MT_SUBTYPE, &subtype);
  EXPECT_EQ(subtype, MFAudioFormat_Float);
  UINT32 value = 0;
  type->GetUINT32(MF_MT_AUDIO_CHANNEL_MASK, &value);
  EXPECT_EQ(value, 3u);
  type->GetUINT32(MF_MT_AUDIO_BLOCK_ALIGNMENT, &value);
  EXPECT_EQ(value, 8u);

  WAVEFORMATEX plain = format.Format;
  plain.wFormatTag = WAVE_FORMAT_PCM;
  plain.wBitsPerSample = 16;
  plain.cbSize = 0;
  ComPtr<IMFMediaType> pcm;
  MFCreateMediaType(&pcm);
  ASSERT_EQ(MFInitMediaTypeFromWaveFormatEx(pcm.Get(), &plain, sizeof plain), S_OK);
  pcm->GetGUID(MF_MT_SUBTYPE, &subtype);
  EXPECT_EQ(subtype, MFAudioFormat_PCM);
  EXPECT_EQ(pcm->GetUINT32(MF_MT_AUDIO_CHANNEL_MASK, &value), MF_E_ATTRIBUTENOTFOUND);
}

TEST(Samples, BuffersTimesAndContiguousCopies) {
  ComPtr<IMFMediaBuffer> a;
  ComPtr<IMFMediaBuffer> b;
  ASSERT_EQ(MFCreateMemoryBuffer(4, &a), S_OK);
  ASSERT_EQ(MFCreateMemoryBuffer(8, &b), S_OK);
  BYTE* data = nullptr;
  DWORD max = 0, current = 9;
  a->Lock(&data, &max, &current);
  EXPECT_EQ(max, 4u);
  EXPECT_EQ(current, 0u);
  EXPECT_EQ(reinterpret_cast<uintptr_t>(data) % 16, 0u);
  std::memcpy(data, "abcd", 4);  // NOLINT(bugprone-not-null-terminated-result): bytes, not text
  a->Unlock();
  EXPECT_EQ(a->SetCurrentLength(5), E_INVALIDARG);
  a->SetCurrentLength(4);
  b->Lock(&data, nullptr, nullptr);
  std::memcpy(data, "ef", 2);  // NOLINT(bugprone-not-null-terminated-result): bytes, not text
  b->Unlock();
  b->SetCurrentLength(2);

  ComPtr<IMFSample> sample;
  MFCreateSample(&sample);
  LONGLONG time = 0;
  EXPECT_EQ(sample->GetSampleTime(&time), MF_E_NO_SAMPLE_TIMESTAMP);
  EXPECT_EQ(sample->GetSampleDuration(&time), MF_E_NO_SAMPLE_DURATION);
  sample->SetSampleTime(5);
  EXPECT_EQ(sample->GetSampleTime(&time), S_OK);
  EXPECT_EQ(time, 5);
  ComPtr<IMFMediaBuffer> joined;
  EXPECT_EQ(sample->ConvertToContiguousBuffer(&joined), E_UNEXPECTED);
  sample->AddBuffer(a.Get());
  sample->AddBuffer(b.Get());
  DWORD count = 0;
  ASSERT_EQ(sample->ConvertToContiguousBuffer(&joined), S_OK);
  joined->Lock(&data, nullptr, &current);
  EXPECT_EQ(std::string(reinterpret_cast<char*>(data), current), "abcdef");
  joined->Unlock();
  sample->GetBufferCount(&count);
  EXPECT_EQ(count, 1u);
}

TEST(Collections, HoldReferencesInOrder) {
  ComPtr<IMFCollection> collection;
  ASSERT_EQ(MFCreateCollection(&collection), S_OK);
  ComPtr<IMFMediaType> first, second;
  MFCreateMediaType(&first);
  MFCreateMediaType(&second);
  collection->AddElement(first.Get());
  collection->AddElement(second.Get());
  IUnknown* const expected[] = {first.Get(), second.Get()};
  first.Reset();  // the collection's reference keeps it
  for (DWORD i = 0; i < 2; ++i) {
    ComPtr<IUnknown> element;
    ASSERT_EQ(collection->GetElement(i, &element), S_OK);
    EXPECT_EQ(element.Get(), expected[i]);
  }
  ComPtr<IUnknown> none;
  EXPECT_EQ(collection->GetElement(2, &none), E_INVALIDARG);
}

}  // namespace
