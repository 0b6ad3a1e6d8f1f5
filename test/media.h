// Reads recorded files back with libavformat and libavcodec, for the encoder tests.
#pragma once

#include <cmath>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "platform/mf.h"

extern "C" {
#include <libavcodec/avcodec.h>
#include <libavformat/avformat.h>
#include <libavutil/channel_layout.h>
#include <libswresample/swresample.h>
#include <libswscale/swscale.h>
}

namespace media {

// Media Foundation started for as long as it lives, as every writer and engine needs it.
struct MediaFoundation {
  MediaFoundation() { EXPECT_EQ(MFStartup(MF_VERSION, MFSTARTUP_FULL), S_OK); }
  ~MediaFoundation() { EXPECT_EQ(MFShutdown(), S_OK); }
};

// A folder of its own for a test's files, removed with everything in it.
class TempFolder {
 public:
  TempFolder() {
    std::string pattern = (std::filesystem::temp_directory_path() / "tavio-media-XXXXXX").string();
    path_ = mkdtemp(pattern.data());
  }
  ~TempFolder() {
    std::error_code ignored;
    std::filesystem::remove_all(path_, ignored);
  }
  std::string file(const std::string& name) const { return path_ + "/" + name; }
  const std::string& path() const { return path_; }

 private:
  std::string path_;
};

struct Packet {
  double time;  // seconds
  bool key;
};

struct Stream {
  std::string codec;
  int profile = 0;
  int width = 0;
  int height = 0;
  AVRational rFrameRate{0, 1};
  AVRational avgFrameRate{0, 1};
  int sampleRate = 0;
  int channels = 0;
  std::vector<Packet> packets;
  int64_t bytes = 0;  // sum of packet sizes
};

struct File {
  bool opened = false;
  double duration = 0;  // seconds, the container's
  std::vector<Stream> streams;
};

inline File probe(const std::string& path) {
  File file;
  AVFormatContext* format = nullptr;
  if (avformat_open_input(&format, path.c_str(), nullptr, nullptr) < 0) return file;
  if (avformat_find_stream_info(format, nullptr) < 0) {
    avformat_close_input(&format);
    return file;
  }
  file.opened = true;
  file.duration = format->duration == AV_NOPTS_VALUE ? 0 : format->duration / double(AV_TIME_BASE);
  for (unsigned i = 0; i < format->nb_streams; ++i) {
    const AVStream* s = format->streams[i];
    Stream stream;
    stream.codec = avcodec_get_name(s->codecpar->codec_id);
    stream.profile = s->codecpar->profile;
    stream.width = s->codecpar->width;
    stream.height = s->codecpar->height;
    stream.rFrameRate = s->r_frame_rate;
    stream.avgFrameRate = s->avg_frame_rate;
    stream.sampleRate = s->codecpar->sample_rate;
    stream.channels = s->codecpar->ch_layout.nb_channels;
    file.streams.push_back(stream);
  }
  av_seek_frame(format, -1, 0, AVSEEK_FLAG_BACKWARD);
  AVPacket* packet = av_packet_alloc();
  while (av_read_frame(format, packet) >= 0) {
    const AVRational tb = format->streams[packet->stream_index]->time_base;
    file.streams[packet->stream_index].packets.push_back(
        {packet->pts * av_q2d(tb), (packet->flags & AV_PKT_FLAG_KEY) != 0});
    file.streams[packet->stream_index].bytes += packet->size;
    av_packet_unref(packet);
  }
  av_packet_free(&packet);
  avformat_close_input(&format);
  return file;
}

// The key-frame marks the container itself gives the packets of its first stream (an MP4's
// sync-sample table), read without the parser that would find key frames in the bit stream.
inline std::vector<bool> containerKeys(const std::string& path) {
  std::vector<bool> keys;
  AVFormatContext* format = avformat_alloc_context();
  if (!format) return keys;
  format->flags |= AVFMT_FLAG_NOPARSE;
  if (avformat_open_input(&format, path.c_str(), nullptr, nullptr) < 0) return keys;  // frees the context
  AVPacket* packet = av_packet_alloc();
  while (av_read_frame(format, packet) >= 0) {
    if (packet->stream_index == 0) keys.push_back((packet->flags & AV_PKT_FLAG_KEY) != 0);
    av_packet_unref(packet);
  }
  av_packet_free(&packet);
  avformat_close_input(&format);
  return keys;
}

// Decodes every frame of the first stream of the given kind. Video frames come out as packed
// B, G, R, A rows (top-down), audio as interleaved float samples; errors counts decoder failures.
struct Decoded {
  int frames = 0;
  int errors = 0;
  int width = 0;
  std::vector<uint8_t> firstPicture;  // BGRA
  std::vector<uint8_t> lastPicture;   // BGRA
  int channels = 0;
  std::vector<float> samples;  // interleaved
};

inline Decoded decode(const std::string& path, AVMediaType kind) {
  Decoded out;
  AVFormatContext* format = nullptr;
  if (avformat_open_input(&format, path.c_str(), nullptr, nullptr) < 0) return out;
  avformat_find_stream_info(format, nullptr);
  const AVCodec* codec = nullptr;
  const int index = av_find_best_stream(format, kind, -1, -1, &codec, 0);
  if (index < 0) {
    avformat_close_input(&format);
    return out;
  }
  AVCodecContext* context = avcodec_alloc_context3(codec);
  avcodec_parameters_to_context(context, format->streams[index]->codecpar);
  context->err_recognition = AV_EF_EXPLODE;
  avcodec_open2(context, codec, nullptr);
  AVPacket* packet = av_packet_alloc();
  AVFrame* frame = av_frame_alloc();
  SwrContext* resampler = nullptr;
  auto take = [&]() {
    while (avcodec_receive_frame(context, frame) == 0) {
      ++out.frames;
      if (kind == AVMEDIA_TYPE_VIDEO) {
        out.width = frame->width;
        SwsContext* sws =
            sws_getContext(frame->width, frame->height, static_cast<AVPixelFormat>(frame->format), frame->width,
                           frame->height, AV_PIX_FMT_BGRA, SWS_POINT, nullptr, nullptr, nullptr);
        // swscale writes whole blocks: rows of a multiple of 64 bytes, and a spare row.
        const size_t row = static_cast<size_t>(frame->width) * 4, paddedRow = (row + 63) & ~size_t{63};
        std::vector<uint8_t> padded(paddedRow * (frame->height + 1));
        uint8_t* planes[1] = {padded.data()};
        int strides[1] = {static_cast<int>(paddedRow)};
        sws_scale(sws, frame->data, frame->linesize, 0, frame->height, planes, strides);
        sws_freeContext(sws);
        out.lastPicture.resize(row * frame->height);
        for (int y = 0; y < frame->height; ++y) std::memcpy(&out.lastPicture[y * row], &padded[y * paddedRow], row);
        if (out.firstPicture.empty()) out.firstPicture = out.lastPicture;
      } else if (kind == AVMEDIA_TYPE_AUDIO) {
        if (!resampler) {
          out.channels = frame->ch_layout.nb_channels;
          swr_alloc_set_opts2(&resampler, &frame->ch_layout, AV_SAMPLE_FMT_FLT, frame->sample_rate, &frame->ch_layout,
                              static_cast<AVSampleFormat>(frame->format), frame->sample_rate, 0, nullptr);
          swr_init(resampler);
        }
        const size_t at = out.samples.size();
        out.samples.resize(at + static_cast<size_t>(frame->nb_samples) * out.channels);
        uint8_t* planes[1] = {reinterpret_cast<uint8_t*>(out.samples.data() + at)};
        swr_convert(resampler, planes, frame->nb_samples, const_cast<const uint8_t**>(frame->extended_data),
                    frame->nb_samples);
      }
      av_frame_unref(frame);
    }
  };
  while (av_read_frame(format, packet) >= 0) {
    if (packet->stream_index == index && avcodec_send_packet(context, packet) < 0) ++out.errors;
    av_packet_unref(packet);
    take();
  }
  avcodec_send_packet(context, nullptr);
  take();
  swr_free(&resampler);
  av_frame_free(&frame);
  av_packet_free(&packet);
  avcodec_free_context(&context);
  avformat_close_input(&format);
  return out;
}

// What a camera that encodes H.264 itself sends: start-code packets of a red-over-blue picture
// from libx264 at High profile (what the add-on's own encoding never asks for), a key frame every
// `keyInterval` frames. With `globalHeader` the parameter sets come apart, in `header`, and not
// in the packets; without, every key frame carries them.
struct CameraStream {
  std::vector<uint8_t> header;
  std::vector<std::vector<uint8_t>> packets;
  std::vector<bool> keys;
};

inline CameraStream cameraStream(int width, int height, int frames, int keyInterval, bool globalHeader) {
  CameraStream made;
  const AVCodec* codec = avcodec_find_encoder_by_name("libx264");
  if (!codec) return made;
  AVCodecContext* encoder = avcodec_alloc_context3(codec);
  encoder->width = width;
  encoder->height = height;
  encoder->time_base = {1, 30};
  encoder->framerate = {30, 1};
  encoder->pix_fmt = AV_PIX_FMT_YUV420P;
  encoder->gop_size = keyInterval;
  encoder->max_b_frames = 0;
  encoder->thread_count = 1;
  if (globalHeader) encoder->flags |= AV_CODEC_FLAG_GLOBAL_HEADER;
  AVDictionary* options = nullptr;
  av_dict_set(&options, "preset", "superfast", 0);
  av_dict_set(&options, "tune", "zerolatency", 0);
  av_dict_set(&options, "profile", "high", 0);
  av_dict_set(&options, "x264-params", "scenecut=0", 0);
  const int opened = avcodec_open2(encoder, codec, &options);
  av_dict_free(&options);
  if (opened < 0) {
    avcodec_free_context(&encoder);
    return made;
  }
  if (encoder->extradata_size > 0) made.header.assign(encoder->extradata, encoder->extradata + encoder->extradata_size);
  AVFrame* frame = av_frame_alloc();
  frame->format = AV_PIX_FMT_YUV420P;
  frame->width = width;
  frame->height = height;
  av_frame_get_buffer(frame, 0);
  AVPacket* packet = av_packet_alloc();
  auto take = [&] {
    while (avcodec_receive_packet(encoder, packet) == 0) {
      made.packets.emplace_back(packet->data, packet->data + packet->size);
      made.keys.push_back((packet->flags & AV_PKT_FLAG_KEY) != 0);
      av_packet_unref(packet);
    }
  };
  for (int i = 0; i < frames; ++i) {
    av_frame_make_writable(frame);
    // BT.601 limited range: red Y 81 U 90 V 240, blue Y 41 U 240 V 110; a moving stripe so
    // that the frames differ.
    for (int y = 0; y < height; ++y)
      for (int x = 0; x < width; ++x)
        frame->data[0][y * frame->linesize[0] + x] = x == i % width ? 200 : y < height / 2 ? 81 : 41;
    for (int y = 0; y < height / 2; ++y)
      for (int x = 0; x < width / 2; ++x) {
        frame->data[1][y * frame->linesize[1] + x] = y < height / 4 ? 90 : 240;
        frame->data[2][y * frame->linesize[2] + x] = y < height / 4 ? 240 : 110;
      }
    frame->pts = i;
    avcodec_send_frame(encoder, frame);
    take();
  }
  avcodec_send_frame(encoder, nullptr);
  take();
  av_packet_free(&packet);
  av_frame_free(&frame);
  avcodec_free_context(&encoder);
  return made;
}

// The power of one frequency in a block of mono samples (Goertzel).
inline double power(const std::vector<float>& mono, double frequency, int sampleRate) {
  const double w = 2 * M_PI * frequency / sampleRate, c = 2 * std::cos(w);
  double s1 = 0, s2 = 0;
  for (float x : mono) {
    const double s0 = x + c * s1 - s2;
    s2 = s1;
    s1 = s0;
  }
  return (s1 * s1 + s2 * s2 - c * s1 * s2) / (mono.size() * double(mono.size()));
}

// One channel of interleaved samples.
inline std::vector<float> channel(const std::vector<float>& interleaved, int channels, int which) {
  std::vector<float> out;
  for (size_t i = which; i < interleaved.size(); i += channels) out.push_back(interleaved[i]);
  return out;
}

}  // namespace media
