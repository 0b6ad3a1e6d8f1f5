// The H.264 sink writer at 1920x1080 with a screen-like picture (a detailed still desktop and a
// moving, changing window), against the colour conversion alone and the 30 fps budget, in one run.
//   sinkwriter_bench [frames]
#include <chrono>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <random>
#include <string>
#include <vector>

extern "C" {
#include <libswscale/swscale.h>
#include <libavutil/frame.h>
}

#include "platform/mf.h"

namespace {

constexpr UINT32 width = 1920, height = 1080;

void paint(std::vector<uint8_t>& pixels, int frame) {
  static std::vector<uint8_t> desktop;
  if (desktop.empty()) {
    desktop.resize(pixels.size());
    std::mt19937 random(1);
    for (UINT32 y = 0; y < height; ++y)
      for (UINT32 x = 0; x < width; ++x) {
        uint8_t* p = &desktop[(y * width + x) * 4];
        const bool text = (y % 20) < 12 && (x % 9) < 6 && (random() % 3 == 0);  // glyph-like specks
        p[0] = text ? 20 : static_cast<uint8_t>(200 - y / 8);
        p[1] = text ? 20 : static_cast<uint8_t>(180 - x / 16);
        p[2] = text ? 20 : 90;
        p[3] = 0;
      }
  }
  std::memcpy(pixels.data(), desktop.data(), pixels.size());
  const UINT32 left = 200 + (frame * 7) % 1200, top = 150 + (frame * 3) % 500;
  for (UINT32 y = top; y < top + 300; ++y)
    for (UINT32 x = left; x < left + 500; ++x) {
      uint8_t* p = &pixels[(y * width + x) * 4];
      p[0] = static_cast<uint8_t>(x + frame * 5);
      p[1] = static_cast<uint8_t>(y * 2 - frame);
      p[2] = static_cast<uint8_t>((x ^ y) + frame);
    }
}

double now() {
  return std::chrono::duration<double, std::milli>(std::chrono::steady_clock::now().time_since_epoch()).count();
}

}  // namespace

int main(int argc, char** argv) {
  const int frames = argc > 1 ? std::atoi(argv[1]) : 150;
  std::vector<uint8_t> pixels(static_cast<size_t>(width) * height * 4);

  // Reference: the one colour conversion the H.264 path makes, alone.
  SwsContext* sws = sws_getContext(width, height, AV_PIX_FMT_BGR0, width, height, AV_PIX_FMT_YUV420P, SWS_BILINEAR,
                                   nullptr, nullptr, nullptr);
  AVFrame* yuv = av_frame_alloc();
  yuv->format = AV_PIX_FMT_YUV420P;
  yuv->width = width;
  yuv->height = height;
  av_frame_get_buffer(yuv, 0);
  double convert = 0;
  for (int i = 0; i < frames; ++i) {
    paint(pixels, i);
    const uint8_t* planes[1] = {pixels.data() + static_cast<size_t>(width) * 4 * (height - 1)};
    const int strides[1] = {-static_cast<int>(width) * 4};
    const double start = now();
    sws_scale(sws, planes, strides, 0, height, yuv->data, yuv->linesize);
    convert += now() - start;
  }
  sws_freeContext(sws);
  av_frame_free(&yuv);

  MFStartup(MF_VERSION, MFSTARTUP_FULL);
  IMFAttributes* attributes = nullptr;
  MFCreateAttributes(&attributes, 0);
  attributes->SetUINT32(MF_LOW_LATENCY, TRUE);
  attributes->SetUINT32(MF_READWRITE_ENABLE_HARDWARE_TRANSFORMS, TRUE);
  attributes->SetGUID(MF_TRANSCODE_CONTAINERTYPE, MFTranscodeContainerType_MPEG4);
  const std::string path = "/tmp/tavio-sinkwriter-bench.mp4";
  IMFSinkWriter* writer = nullptr;
  if (FAILED(MFCreateSinkWriterFromURL(platform::widen(path).c_str(), nullptr, attributes, &writer))) return 1;
  attributes->Release();
  IMFMediaType* out = nullptr;
  MFCreateMediaType(&out);
  out->SetGUID(MF_MT_MAJOR_TYPE, MFMediaType_Video);
  out->SetGUID(MF_MT_SUBTYPE, MFVideoFormat_H264);
  out->SetUINT32(MF_MT_AVG_BITRATE, 10485760);
  MFSetAttributeSize(out, MF_MT_FRAME_SIZE, width, height);
  MFSetAttributeRatio(out, MF_MT_FRAME_RATE, 30, 1);
  out->SetUINT32(MF_MT_MPEG2_PROFILE, eAVEncH264VProfile_Main);
  DWORD stream = 0;
  writer->AddStream(out, &stream);
  out->Release();
  IMFMediaType* in = nullptr;
  MFCreateMediaType(&in);
  in->SetGUID(MF_MT_MAJOR_TYPE, MFMediaType_Video);
  in->SetGUID(MF_MT_SUBTYPE, MFVideoFormat_RGB32);
  MFSetAttributeSize(in, MF_MT_FRAME_SIZE, width, height);
  MFSetAttributeRatio(in, MF_MT_FRAME_RATE, 30, 1);
  if (FAILED(writer->SetInputMediaType(stream, in, nullptr)) || FAILED(writer->BeginWriting())) return 1;
  in->Release();

  double write = 0;
  for (int i = 0; i < frames; ++i) {
    paint(pixels, i);
    IMFMediaBuffer* buffer = nullptr;
    MFCreateMemoryBuffer(static_cast<DWORD>(pixels.size()), &buffer);
    BYTE* data = nullptr;
    buffer->Lock(&data, nullptr, nullptr);
    std::memcpy(data, pixels.data(), pixels.size());
    buffer->Unlock();
    buffer->SetCurrentLength(static_cast<DWORD>(pixels.size()));
    IMFSample* sample = nullptr;
    MFCreateSample(&sample);
    sample->AddBuffer(buffer);
    sample->SetSampleTime(i * 333333LL);
    sample->SetSampleDuration(333333);
    const double start = now();
    if (FAILED(writer->WriteSample(stream, sample))) return 1;
    write += now() - start;
    sample->Release();
    buffer->Release();
  }
  const double start = now();
  writer->Finalize();
  const double finalize = now() - start;
  writer->Release();
  MFShutdown();

  std::printf("1920x1080, %d frames\n", frames);
  std::printf("colour conversion alone: %6.2f ms/frame\n", convert / frames);
  std::printf("WriteSample (H.264):     %6.2f ms/frame = %.1f fps (budget 33.33 ms for 30 fps)\n", write / frames,
              1000 * frames / write);
  std::printf("Finalize:                %6.2f ms\n", finalize);
  std::remove(path.c_str());
  return 0;
}
