// The sink writer's streams: each encodes (or copies) one stream's samples and hands its packets
// to the muxer, committing every fragment the muxer completes to the file. Shared here: the
// stream base, the video clock, FFmpeg's resource holders and the attribute readers.
#pragma once

#include <algorithm>
#include <memory>

extern "C" {
#include <libavcodec/avcodec.h>
#include <libavformat/avformat.h>
#include <libavutil/audio_fifo.h>
#include <libswresample/swresample.h>
#include <libswscale/swscale.h>
}

#include "platform/linux/ffmpeg/mp4file.h"
#include "platform/linux/mf.h"

namespace platform::sinkwriter {

constexpr AVRational hundredNanoseconds{1, 10000000};
constexpr int videoTimescale = 90000;  // whole ticks for 24, 25, 30, 50 and 60 fps and for milliseconds

// The Win32 error a failed file operation gives on Windows, as an HRESULT.
HRESULT fromErrno(int error);
HRESULT fromAv(int error);
UINT32 get32(IMFAttributes* attributes, REFGUID key, UINT32 fallback);
bool getPair(IMFAttributes* attributes, REFGUID key, UINT32* high, UINT32* low);
GUID getGuid(IMFAttributes* attributes, REFGUID key);

struct CodecContextDeleter {
  void operator()(AVCodecContext* context) const { avcodec_free_context(&context); }
};
struct FrameDeleter {
  void operator()(AVFrame* frame) const { av_frame_free(&frame); }
};
struct PacketDeleter {
  void operator()(AVPacket* packet) const { av_packet_free(&packet); }
};
struct SwsDeleter {
  void operator()(SwsContext* context) const { sws_freeContext(context); }
};
struct SwrDeleter {
  void operator()(SwrContext* context) const { swr_free(&context); }
};
struct FifoDeleter {
  void operator()(AVAudioFifo* fifo) const { av_audio_fifo_free(fifo); }
};
struct BufferRefDeleter {
  void operator()(AVBufferRef* buffer) const { av_buffer_unref(&buffer); }
};
using CodecContextPtr = std::unique_ptr<AVCodecContext, CodecContextDeleter>;
using FramePtr = std::unique_ptr<AVFrame, FrameDeleter>;
using PacketPtr = std::unique_ptr<AVPacket, PacketDeleter>;
using BufferRefPtr = std::unique_ptr<AVBufferRef, BufferRefDeleter>;

// One stream's encoder (or copier); it hands every packet it makes to the muxer through mux().
class StreamEncoder {
 public:
  StreamEncoder(AVFormatContext* format, AVStream* stream, Mp4File* file)
      : format_(format), stream_(stream), file_(file) {}
  virtual ~StreamEncoder() = default;

  // The codec parameters the muxer needs, once the encoder is open.
  HRESULT describe() { return fromAv(avcodec_parameters_from_context(stream_->codecpar, context_.get())); }
  // One sample's bytes. Times are in 100 ns; hasTime false continues from the previous sample.
  // cleanPoint: the sample can be decoded on its own (it matters only to copied streams).
  virtual HRESULT write(const uint8_t* data, DWORD length, LONGLONG time, bool hasTime, LONGLONG duration,
                        bool hasDuration, bool cleanPoint) = 0;
  // Drains the encoder into the muxer.
  virtual HRESULT finish() = 0;
  // Forgets buffered input that has not been encoded yet.
  virtual void flush() {}

  uint64_t packets() const { return packets_; }

 protected:
  // Takes every packet the encoder has ready; `stamp` gives each one its times.
  template <class Stamp>
  HRESULT drain(Stamp stamp) {
    for (;;) {
      int result = avcodec_receive_packet(context_.get(), packet_.get());
      if (result == AVERROR(EAGAIN) || result == AVERROR_EOF) return S_OK;
      if (result < 0) return fromAv(result);
      stamp(packet_.get());
      HRESULT hr = mux(packet_.get());
      av_packet_unref(packet_.get());
      if (FAILED(hr)) return hr;
    }
  }

  // Writes a packet whose times are in the stream's time base, keeping decoding times rising.
  // A packet that makes the muxer write out a fragment closes it before itself, so the file
  // then holds this stream up to the end of the packet before.
  HRESULT mux(AVPacket* packet) {
    packet->stream_index = stream_->index;
    if (packet->dts == AV_NOPTS_VALUE) packet->dts = packet->pts;
    if (lastDts_ != AV_NOPTS_VALUE && packet->dts <= lastDts_) packet->dts = lastDts_ + 1;
    if (packet->pts != AV_NOPTS_VALUE && packet->pts < packet->dts) packet->pts = packet->dts;
    lastDts_ = packet->dts;
    ++packets_;
    const int64_t start = packet->pts != AV_NOPTS_VALUE ? packet->pts : packet->dts;
    const double end = av_q2d(stream_->time_base) * static_cast<double>(start + std::max<int64_t>(packet->duration, 0));
    const int64_t lengthBefore = file_ ? file_->length() : 0;
    const int result = av_interleaved_write_frame(format_, packet);
    if (file_) {
      if (result < 0) {
        file_->rollback();
      } else {
        if (file_->length() > lengthBefore) {
          file_->setTrackEnd(static_cast<size_t>(stream_->index), end_);
          file_->stampDurations();
        }
        file_->commit();
      }
    }
    end_ = std::max(end_, end);
    return fromAv(result);
  }

 public:
  // The end of the last packet written, in seconds.
  double end() const { return end_; }

 protected:
  AVFormatContext* format_;
  AVStream* stream_;
  Mp4File* file_;
  CodecContextPtr context_;
  PacketPtr packet_{av_packet_alloc()};

 private:
  int64_t lastDts_ = AV_NOPTS_VALUE;
  uint64_t packets_ = 0;
  double end_ = 0;
};

// A video stream's sample times. The rate is the output type's (30/1 when it names none); a
// sample without a time follows the one before, one without a duration lasts one frame.
class VideoClock {
 public:
  // Reads the rate and declares it on the stream, whose times are in 1/90000 s.
  void open(IMFMediaType* output, AVStream* stream) {
    UINT32 num = 30, den = 1;
    if (!getPair(output, MF_MT_FRAME_RATE, &num, &den) || !num || !den) num = 30, den = 1;
    rate_ = {static_cast<int>(num), static_cast<int>(den)};
    interval_ = av_rescale_q(1, av_inv_q(rate_), hundredNanoseconds);
    stream->time_base = {1, videoTimescale};
    stream->avg_frame_rate = rate_;
    stream->r_frame_rate = rate_;
  }

  // Fills in what the sample left out, and moves on past it.
  void stamp(LONGLONG& time, bool hasTime, LONGLONG& duration, bool hasDuration) {
    if (!hasTime) time = next_;
    if (!hasDuration) duration = interval_;
    next_ = time + duration;
  }

  AVRational rate() const { return rate_; }
  LONGLONG interval() const { return interval_; }
  LONGLONG next() const { return next_; }

 private:
  AVRational rate_{30, 1};
  LONGLONG interval_ = 333333;
  LONGLONG next_ = 0;
};

// Opens a new stream of kind E (its open() takes `how`), which becomes *encoder if that succeeds.
template <class E, class... How>
HRESULT openStream(AVFormatContext* format, AVStream* stream, Mp4File* file, std::unique_ptr<StreamEncoder>* encoder,
                   How... how) {
  auto made = std::make_unique<E>(format, stream, file);
  const HRESULT hr = made->open(how...);
  if (SUCCEEDED(hr)) *encoder = std::move(made);
  return hr;
}

// The three kinds of stream: each checks the types, opens its codec and declares the stream.
HRESULT openVideoEncoder(AVFormatContext* format, AVStream* stream, Mp4File* file, IMFMediaType* output,
                         IMFMediaType* input, bool hardware, std::unique_ptr<StreamEncoder>* encoder);
HRESULT openVideoCopy(AVFormatContext* format, AVStream* stream, Mp4File* file, IMFMediaType* output,
                      IMFMediaType* input, std::unique_ptr<StreamEncoder>* encoder);
HRESULT openAudioEncoder(AVFormatContext* format, AVStream* stream, Mp4File* file, IMFMediaType* output,
                         IMFMediaType* input, std::unique_ptr<StreamEncoder>* encoder);

}  // namespace platform::sinkwriter
