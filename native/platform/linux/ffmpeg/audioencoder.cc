// AAC through FFmpeg's own encoder: any PCM or float input is resampled to the encoder's format
// (a rate or layout it does not take becomes the nearest one it does) and cut into its frame size.
#include <cstdlib>
#include <cstring>

extern "C" {
#include <libavutil/channel_layout.h>
}

#include "platform/linux/ffmpeg/streamencoder.h"

namespace platform::sinkwriter {

namespace {

bool inputSamples(REFGUID subtype, UINT32 bits, AVSampleFormat* format) {
  if (subtype == MFAudioFormat_Float) {
    if (bits == 32)
      *format = AV_SAMPLE_FMT_FLT;
    else if (bits == 64)
      *format = AV_SAMPLE_FMT_DBL;
    else
      return false;
  } else if (subtype == MFAudioFormat_PCM) {
    if (bits == 8)
      *format = AV_SAMPLE_FMT_U8;
    else if (bits == 16)
      *format = AV_SAMPLE_FMT_S16;
    else if (bits == 24 || bits == 32)
      *format = AV_SAMPLE_FMT_S32;  // 24-bit samples are widened first
    else
      return false;
  } else {
    return false;
  }
  return true;
}

// The layout of a wave channel mask (the bits are FFmpeg's too), or the default for the count.
void channelLayout(UINT32 mask, UINT32 channels, AVChannelLayout* layout) {
  if (mask && static_cast<UINT32>(__builtin_popcount(mask)) == channels &&
      av_channel_layout_from_mask(layout, mask) == 0)
    return;
  av_channel_layout_default(layout, static_cast<int>(channels));
}

class AudioEncoder : public StreamEncoder {
 public:
  using StreamEncoder::StreamEncoder;
  ~AudioEncoder() override {
    av_channel_layout_uninit(&inLayout_);
    av_channel_layout_uninit(&outLayout_);
    if (planes_) av_freep(&planes_[0]);
    av_freep(&planes_);
  }

  HRESULT open(IMFMediaType* output, IMFMediaType* input) {
    const UINT32 asked = get32(output, MF_MT_AUDIO_SAMPLES_PER_SECOND, 0);
    const UINT32 channels = get32(output, MF_MT_AUDIO_NUM_CHANNELS, 0);
    const UINT32 inRate = get32(input, MF_MT_AUDIO_SAMPLES_PER_SECOND, 0);
    const UINT32 inChannels = get32(input, MF_MT_AUDIO_NUM_CHANNELS, 0);
    bits_ = get32(input, MF_MT_AUDIO_BITS_PER_SAMPLE, 0);
    if (!asked || !channels || !inRate || !inChannels || !bits_) return MF_E_INVALIDMEDIATYPE;
    if (!inputSamples(getGuid(input, MF_MT_SUBTYPE), bits_, &inFormat_)) return MF_E_INVALIDMEDIATYPE;
    blockAlign_ = get32(input, MF_MT_AUDIO_BLOCK_ALIGNMENT, inChannels * bits_ / 8);
    if (blockAlign_ < inChannels * bits_ / 8) return MF_E_INVALIDMEDIATYPE;
    inChannels_ = inChannels;

    const AVCodec* codec = avcodec_find_encoder(AV_CODEC_ID_AAC);
    if (!codec) return MF_E_INVALIDMEDIATYPE;
    const UINT32 rate = encoderRate(codec, asked);
    const UINT32 mask = get32(input, MF_MT_AUDIO_CHANNEL_MASK, 0);
    channelLayout(mask, inChannels, &inLayout_);
    // The output keeps the input's layout when the encoder takes it (tried first, quietly: that
    // failure is not the recording's), else the channels are mixed by name into the default
    // layout of their count. AAC takes few layouts beyond its own, and FFmpeg 5 lists none.
    channelLayout(channels == inChannels ? mask : 0, channels, &outLayout_);

    const int64_t bitRate = static_cast<int64_t>(get32(output, MF_MT_AUDIO_AVG_BYTES_PER_SECOND, 16000)) * 8;
    CodecContextPtr context = openContext(codec, rate, bitRate, AV_LOG_INFO - AV_LOG_ERROR);
    if (!context) {
      av_channel_layout_uninit(&outLayout_);
      av_channel_layout_default(&outLayout_, static_cast<int>(channels));
      context = openContext(codec, rate, bitRate, 0);
    }
    if (!context) return MF_E_INVALIDMEDIATYPE;
    context_ = std::move(context);
    rate_ = rate;

    SwrContext* resampler = nullptr;
    if (swr_alloc_set_opts2(&resampler, &outLayout_, AV_SAMPLE_FMT_FLTP, static_cast<int>(rate), &inLayout_, inFormat_,
                            static_cast<int>(inRate), 0, nullptr) < 0)
      return MF_E_INVALIDMEDIATYPE;
    resampler_.reset(resampler);
    if (swr_init(resampler_.get()) < 0) return MF_E_INVALIDMEDIATYPE;
    fifo_.reset(av_audio_fifo_alloc(AV_SAMPLE_FMT_FLTP, outLayout_.nb_channels, 4 * context_->frame_size));
    frame_.reset(av_frame_alloc());
    frame_->format = AV_SAMPLE_FMT_FLTP;
    frame_->sample_rate = static_cast<int>(rate);
    frame_->nb_samples = context_->frame_size;
    av_channel_layout_copy(&frame_->ch_layout, &outLayout_);
    if (!fifo_ || av_frame_get_buffer(frame_.get(), 0) < 0) return E_OUTOFMEMORY;

    stream_->time_base = {1, static_cast<int>(rate)};
    return describe();
  }

  // The samples go through the converter into the FIFO, which the encoder empties in frames of
  // its own size. A sample time well ahead of where the audio has got to (a gap in capture)
  // is filled with silence, so the file keeps the samples' times.
  HRESULT write(const uint8_t* data, DWORD length, LONGLONG time, bool hasTime, LONGLONG, bool, bool) override {
    const int frames = static_cast<int>(length / blockAlign_);
    if (hasTime) {
      const int64_t position = av_rescale_q(time, hundredNanoseconds, {1, static_cast<int>(rate_)});
      if (!started_) {
        framePts_ = nextPosition_ = position;
      } else {
        const int64_t tolerance = std::max<int64_t>(context_->frame_size, rate_ / 25);  // 40 ms
        if (position - nextPosition_ > tolerance) {
          HRESULT hr = silence(position - nextPosition_);
          if (FAILED(hr)) return hr;
        }
      }
    }
    started_ = true;
    if (frames == 0) return S_OK;

    const uint8_t* in[1] = {data};
    std::vector<int32_t> widened;
    if (bits_ == 24) {  // packed 24-bit samples into the top of 32-bit ones
      widened.resize(static_cast<size_t>(frames) * inChannels_);
      for (size_t f = 0; f < static_cast<size_t>(frames); ++f) {
        const uint8_t* block = data + f * blockAlign_;
        for (size_t c = 0; c < inChannels_; ++c) {
          const uint8_t* s = block + c * 3;
          widened[f * inChannels_ + c] =
              static_cast<int32_t>((static_cast<uint32_t>(s[0]) << 8) | (static_cast<uint32_t>(s[1]) << 16) |
                                   (static_cast<uint32_t>(s[2]) << 24));
        }
      }
      in[0] = reinterpret_cast<const uint8_t*>(widened.data());
    } else if (blockAlign_ != inChannels_ * bits_ / 8) {
      return MF_E_INVALIDMEDIATYPE;  // padded blocks of other widths are not produced by any capture path
    }
    HRESULT hr = convert(in, frames);
    if (FAILED(hr)) return hr;
    return encodeFull();
  }

  HRESULT finish() override {
    if (!context_) return S_OK;
    HRESULT hr = convert(nullptr, 0);  // what the resampler still holds
    if (SUCCEEDED(hr)) hr = encodeFull();
    const int left = av_audio_fifo_size(fifo_.get());
    if (SUCCEEDED(hr) && left > 0) hr = encodeFrame(left);
    if (FAILED(hr)) return hr;
    int result = avcodec_send_frame(context_.get(), nullptr);
    if (result < 0 && result != AVERROR_EOF) return fromAv(result);
    return drainAudio();
  }

  void flush() override { av_audio_fifo_reset(fifo_.get()); }

 private:
  // The rate the encoder takes nearest to `asked`: AAC's go up to 96 kHz.
  static UINT32 encoderRate(const AVCodec* codec, UINT32 asked) {
    if (!codec->supported_samplerates) return asked;
    int64_t best = 0;
    for (const int* r = codec->supported_samplerates; *r; ++r)
      if (!best || std::abs(*r - static_cast<int64_t>(asked)) < std::abs(best - static_cast<int64_t>(asked))) best = *r;
    return static_cast<UINT32>(best);
  }

  // The encoder opened on outLayout_, or none; `logOffset` raises the level of what it logs.
  CodecContextPtr openContext(const AVCodec* codec, UINT32 rate, int64_t bitRate, int logOffset) {
    CodecContextPtr context(avcodec_alloc_context3(codec));
    if (!context) return nullptr;
    context->log_level_offset = logOffset;
    context->sample_fmt = AV_SAMPLE_FMT_FLTP;
    context->sample_rate = static_cast<int>(rate);
    av_channel_layout_copy(&context->ch_layout, &outLayout_);
    context->bit_rate = bitRate;
    context->time_base = {1, static_cast<int>(rate)};
    if (format_->oformat->flags & AVFMT_GLOBALHEADER) context->flags |= AV_CODEC_FLAG_GLOBAL_HEADER;
    if (avcodec_open2(context.get(), codec, nullptr) < 0) return nullptr;
    context->log_level_offset = 0;
    return context;
  }

  HRESULT convert(const uint8_t** in, int frames) {
    const int capacity = swr_get_out_samples(resampler_.get(), frames);
    if (capacity <= 0) return S_OK;
    if (capacity > planeCapacity_) {
      if (planes_) av_freep(&planes_[0]);
      av_freep(&planes_);
      if (av_samples_alloc_array_and_samples(&planes_, nullptr, outLayout_.nb_channels, capacity, AV_SAMPLE_FMT_FLTP,
                                             0) < 0)
        return E_OUTOFMEMORY;
      planeCapacity_ = capacity;
    }
    const int converted = swr_convert(resampler_.get(), planes_, capacity, in, frames);
    if (converted < 0) return fromAv(converted);
    if (converted > 0 && av_audio_fifo_write(fifo_.get(), reinterpret_cast<void**>(planes_), converted) < converted)
      return E_OUTOFMEMORY;
    nextPosition_ += converted;
    return S_OK;
  }

  HRESULT silence(int64_t samples) {
    while (samples > 0) {
      const int chunk = static_cast<int>(std::min<int64_t>(samples, context_->frame_size));
      if (av_frame_make_writable(frame_.get()) < 0) return E_OUTOFMEMORY;
      av_samples_set_silence(frame_->data, 0, chunk, outLayout_.nb_channels, AV_SAMPLE_FMT_FLTP);
      if (av_audio_fifo_write(fifo_.get(), reinterpret_cast<void**>(frame_->data), chunk) < chunk) return E_OUTOFMEMORY;
      nextPosition_ += chunk;
      samples -= chunk;
      HRESULT hr = encodeFull();
      if (FAILED(hr)) return hr;
    }
    return S_OK;
  }

  HRESULT encodeFull() {
    while (av_audio_fifo_size(fifo_.get()) >= context_->frame_size) {
      HRESULT hr = encodeFrame(context_->frame_size);
      if (FAILED(hr)) return hr;
    }
    return S_OK;
  }

  HRESULT encodeFrame(int samples) {
    int result = av_frame_make_writable(frame_.get());
    if (result < 0) return fromAv(result);
    frame_->nb_samples = samples;
    if (av_audio_fifo_read(fifo_.get(), reinterpret_cast<void**>(frame_->data), samples) < samples) return E_FAIL;
    frame_->pts = framePts_;
    framePts_ += samples;
    result = avcodec_send_frame(context_.get(), frame_.get());
    frame_->nb_samples = context_->frame_size;
    if (result < 0) return fromAv(result);
    return drainAudio();
  }

  HRESULT drainAudio() {
    return drain([this](AVPacket* packet) { av_packet_rescale_ts(packet, context_->time_base, stream_->time_base); });
  }

  UINT32 bits_ = 0;
  UINT32 blockAlign_ = 0;
  UINT32 inChannels_ = 0;
  UINT32 rate_ = 0;
  AVSampleFormat inFormat_ = AV_SAMPLE_FMT_NONE;
  AVChannelLayout inLayout_{};
  AVChannelLayout outLayout_{};
  std::unique_ptr<SwrContext, SwrDeleter> resampler_;
  std::unique_ptr<AVAudioFifo, FifoDeleter> fifo_;
  FramePtr frame_;
  uint8_t** planes_ = nullptr;
  int planeCapacity_ = 0;
  bool started_ = false;
  int64_t nextPosition_ = 0;  // output samples: where the next converted sample lies
  int64_t framePts_ = 0;      // output samples: the time of the next frame given to the encoder
};

}  // namespace

HRESULT openAudioEncoder(AVFormatContext* format, AVStream* stream, Mp4File* file, IMFMediaType* output,
                         IMFMediaType* input, std::unique_ptr<StreamEncoder>* encoder) {
  return openStream<AudioEncoder>(format, stream, file, encoder, output, input);
}

}  // namespace platform::sinkwriter
