// The Media Foundation sink writer on Linux, over FFmpeg. The container comes from
// MF_TRANSCODE_CONTAINERTYPE (else from the file's extension); H.264 output is encoded by a
// hardware encoder when hardware transforms are allowed and one opens, else by libx264 (H.264
// input is copied as it is); AAC by FFmpeg's own encoder. Encoding happens inside WriteSample on
// the caller's thread, so there is nothing to throttle and no queue to wait for; Finalize drains
// the encoders, writes the trailer and closes the file. MP4 is written fragmented as it records
// (the header first, then a fragment of at most 0.9 s at a time, each handed to the system when
// it is complete), so a killed process or a full disk leaves a file that plays up to its last
// fragment, and a finished one starts playing before it has been read to the end.
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <deque>
#include <initializer_list>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

extern "C" {
#include <libavcodec/avcodec.h>
#include <libavformat/avformat.h>
#include <libavutil/audio_fifo.h>
#include <libavutil/channel_layout.h>
#include <libavutil/hwcontext.h>
#include <libavutil/opt.h>
#include <libswresample/swresample.h>
#include <libswscale/swscale.h>
}

#include "platform/linux/ffmpeg/colorconvert.h"
#include "platform/linux/mf.h"
#include "platform/linux/mf/mfstartup.h"
#include "platform/linux/ffmpeg/mp4file.h"

namespace platform {

namespace {

constexpr AVRational hundredNanoseconds{1, 10000000};
constexpr int videoTimescale = 90000;  // whole ticks for 24, 25, 30, 50 and 60 fps and for milliseconds

// The Win32 error a failed file operation gives on Windows, as an HRESULT.
HRESULT fromErrno(int error) {
  switch (error) {
    case ENOENT:  // the file is being created, so what is missing is a folder
    case ENOTDIR:
      return HRESULT_FROM_WIN32(ERROR_PATH_NOT_FOUND);
    case EACCES:
    case EPERM:
    case EISDIR:  // Windows refuses to open a folder as a file with access denied
      return HRESULT_FROM_WIN32(ERROR_ACCESS_DENIED);
    case EROFS:
      return HRESULT_FROM_WIN32(ERROR_WRITE_PROTECT);
    case ENAMETOOLONG:
      return HRESULT_FROM_WIN32(ERROR_FILENAME_EXCED_RANGE);
    case ENOSPC:
    case EDQUOT:
      return HRESULT_FROM_WIN32(ERROR_DISK_FULL);
    case EBUSY:
    case ETXTBSY:
      return HRESULT_FROM_WIN32(ERROR_SHARING_VIOLATION);
    case EEXIST:
      return HRESULT_FROM_WIN32(ERROR_FILE_EXISTS);
    case EINVAL:
      return HRESULT_FROM_WIN32(ERROR_INVALID_NAME);
    case ENOMEM:
      return E_OUTOFMEMORY;
    default:
      return E_FAIL;
  }
}

HRESULT fromAv(int error) {
  if (error >= 0) return S_OK;
  if (error == AVERROR(ENOMEM)) return E_OUTOFMEMORY;
  if (error > -4096) return fromErrno(-error);  // AVERROR(errno)
  return E_FAIL;
}

// FFmpeg's libraries log to standard error at the information level by default; a library
// inside a host process keeps quiet unless the host has chosen a level of its own.
void quietenLogging() {
  static std::once_flag once;
  std::call_once(once, [] {
    if (av_log_get_level() == AV_LOG_INFO) av_log_set_level(AV_LOG_ERROR);
  });
}

UINT32 get32(IMFAttributes* attributes, REFGUID key, UINT32 fallback) {
  UINT32 value = 0;
  return attributes && SUCCEEDED(attributes->GetUINT32(key, &value)) ? value : fallback;
}

bool getPair(IMFAttributes* attributes, REFGUID key, UINT32* high, UINT32* low) {
  UINT64 packed = 0;
  if (!attributes || FAILED(attributes->GetUINT64(key, &packed))) return false;
  *high = static_cast<UINT32>(packed >> 32);
  *low = static_cast<UINT32>(packed);
  return true;
}

GUID getGuid(IMFAttributes* attributes, REFGUID key) {
  GUID value = GUID_NULL;
  if (attributes) attributes->GetGUID(key, &value);
  return value;
}

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

// ---- H.264 ----

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

struct InputPicture {
  AVPixelFormat format;
  int bytesPerPixel;  // of the first plane's packed pixels; 0 for planar YUV
  bool bottomUpByDefault;
};

bool inputPicture(REFGUID subtype, InputPicture* picture) {
  // Media Foundation's RGB32 and ARGB32 lie in memory as B, G, R, X/A; RGB24 as B, G, R.
  if (subtype == MFVideoFormat_RGB32) *picture = {AV_PIX_FMT_BGR0, 4, true};
  else if (subtype == MFVideoFormat_ARGB32) *picture = {AV_PIX_FMT_BGRA, 4, true};
  else if (subtype == MFVideoFormat_RGB24) *picture = {AV_PIX_FMT_BGR24, 3, true};
  else if (subtype == MFVideoFormat_NV12) *picture = {AV_PIX_FMT_NV12, 0, false};
  else if (subtype == MFVideoFormat_YUY2) *picture = {AV_PIX_FMT_YUYV422, 2, false};
  else if (subtype == MFVideoFormat_I420 || subtype == MFVideoFormat_IYUV) *picture = {AV_PIX_FMT_YUV420P, 0, false};
  else return false;
  return true;
}

class VideoEncoder : public StreamEncoder {
 public:
  using StreamEncoder::StreamEncoder;
  ~VideoEncoder() override = default;

  HRESULT open(IMFMediaType* output, IMFMediaType* input, bool hardware) {
    UINT32 width = 0, height = 0, inWidth = 0, inHeight = 0;
    if (!getPair(output, MF_MT_FRAME_SIZE, &width, &height) || !width || !height) return MF_E_INVALIDMEDIATYPE;
    if (!getPair(input, MF_MT_FRAME_SIZE, &inWidth, &inHeight) || !inWidth || !inHeight) return MF_E_INVALIDMEDIATYPE;
    if (!inputPicture(getGuid(input, MF_MT_SUBTYPE), &picture_)) return MF_E_INVALIDMEDIATYPE;
    inWidth_ = static_cast<int>(inWidth);
    inHeight_ = static_cast<int>(inHeight);
    // The stride: the input type's MF_MT_DEFAULT_STRIDE when given (negative: bottom-up rows),
    // else Media Foundation's default, which makes RGB pictures bottom-up.
    const int packedStride = picture_.bytesPerPixel ? (inWidth_ * picture_.bytesPerPixel + 3) & ~3 : inWidth_;
    UINT32 stride = 0;
    if (SUCCEEDED(input->GetUINT32(MF_MT_DEFAULT_STRIDE, &stride)) && stride != 0)
      stride_ = static_cast<INT32>(stride);
    else
      stride_ = picture_.bottomUpByDefault ? -packedStride : packedStride;

    clock_.open(output, stream_);
    const int64_t bitRate = get32(output, MF_MT_AVG_BITRATE, 0);
    const UINT32 profile = get32(output, MF_MT_MPEG2_PROFILE, eAVEncH264VProfile_Base);

    bool opened = false;
    if (hardware) opened = openNvenc(width, height, bitRate, profile) || openVaapi(width, height, bitRate, profile);
    if (!opened && !openX264(width, height, bitRate, profile)) return MF_E_INVALIDMEDIATYPE;

    const AVPixelFormat target = hardwareFrames_ ? AV_PIX_FMT_NV12 : context_->pix_fmt;
    // Four-byte RGB at the output's size is the display path: our own one-pass converter
    // costs a fraction of swscale's, which matters at 60 frames a second.
    directI420_ = picture_.bytesPerPixel == 4 && target == AV_PIX_FMT_YUV420P && inWidth_ == static_cast<int>(width) &&
                  inHeight_ == static_cast<int>(height);
    if (!directI420_) scaler_.reset(sws_getContext(inWidth_, inHeight_, picture_.format, static_cast<int>(width), static_cast<int>(height),
                                 target, SWS_BILINEAR, nullptr, nullptr, nullptr));
    if (!directI420_) {
      if (!scaler_) return MF_E_INVALIDMEDIATYPE;
      // BT.709, limited range, as the stream declares.
      int* table = const_cast<int*>(sws_getCoefficients(SWS_CS_ITU709));
      sws_setColorspaceDetails(scaler_.get(), table, 1, table, 0, 0, 1 << 16, 1 << 16);
    }

    frame_.reset(av_frame_alloc());
    frame_->format = target;
    frame_->width = static_cast<int>(width);
    frame_->height = static_cast<int>(height);
    if (av_frame_get_buffer(frame_.get(), 0) < 0) return E_OUTOFMEMORY;

    return describe();
  }

  HRESULT write(const uint8_t* data, DWORD length, LONGLONG time, bool hasTime, LONGLONG duration,
                bool hasDuration, bool) override {
    clock_.stamp(time, hasTime, duration, hasDuration);
    if (static_cast<int64_t>(length) < requiredLength()) return MF_E_BUFFERTOOSMALL;

    int result = av_frame_make_writable(frame_.get());
    if (result < 0) return fromAv(result);
    const uint8_t* planes[4] = {};
    int strides[4] = {};
    sourcePlanes(data, planes, strides);
    if (directI420_)
      colour::bgrxToI420(planes[0], strides[0], inWidth_, inHeight_, frame_->data[0], frame_->linesize[0],
                         frame_->data[1], frame_->linesize[1], frame_->data[2], frame_->linesize[2]);
    else
      sws_scale(scaler_.get(), planes, strides, 0, inHeight_, frame_->data, frame_->linesize);

    // The encoder counts frames at the declared rate; the packets get the samples' own times back.
    frame_->pts = frameIndex_++;
    pending_.push_back({frame_->pts, time, duration});
    AVFrame* send = frame_.get();
    FramePtr uploaded;
    if (hardwareFrames_) {
      uploaded.reset(av_frame_alloc());
      if ((result = av_hwframe_get_buffer(hardwareFrames_.get(), uploaded.get(), 0)) < 0 ||
          (result = av_hwframe_transfer_data(uploaded.get(), frame_.get(), 0)) < 0)
        return fromAv(result);
      uploaded->pts = frame_->pts;
      send = uploaded.get();
    }
    result = avcodec_send_frame(context_.get(), send);
    if (result < 0) return fromAv(result);
    return drainStamped();
  }

  HRESULT finish() override {
    int result = avcodec_send_frame(context_.get(), nullptr);
    if (result < 0 && result != AVERROR_EOF) return fromAv(result);
    return drainStamped();
  }

 private:
  struct Pending {
    int64_t index;
    LONGLONG time;
    LONGLONG duration;
  };

  int64_t requiredLength() const {
    const int64_t rows = inHeight_;
    const int64_t stride = stride_ < 0 ? -static_cast<int64_t>(stride_) : stride_;
    if (picture_.format == AV_PIX_FMT_NV12 || picture_.format == AV_PIX_FMT_YUV420P) return stride * rows * 3 / 2;
    return stride * rows;
  }

  // The planes of the caller's buffer; bottom-up rows are read from the last row upwards
  // through a negative stride, so the picture is turned upright without a copy of its own.
  void sourcePlanes(const uint8_t* data, const uint8_t** planes, int* strides) const {
    const int stride = stride_ < 0 ? -stride_ : stride_;
    if (picture_.format == AV_PIX_FMT_NV12) {
      planes[0] = data;
      planes[1] = data + static_cast<size_t>(stride) * inHeight_;
      strides[0] = strides[1] = stride;
    } else if (picture_.format == AV_PIX_FMT_YUV420P) {
      planes[0] = data;
      planes[1] = data + static_cast<size_t>(stride) * inHeight_;
      planes[2] = planes[1] + static_cast<size_t>(stride / 2) * (inHeight_ / 2);
      strides[0] = stride;
      strides[1] = strides[2] = stride / 2;
    } else if (stride_ < 0) {
      planes[0] = data + static_cast<size_t>(stride) * (inHeight_ - 1);
      strides[0] = stride_;
    } else {
      planes[0] = data;
      strides[0] = stride_;
    }
  }

  HRESULT drainStamped() {
    return drain([this](AVPacket* packet) {
      while (pending_.size() > 1 && pending_.front().index < packet->pts) pending_.pop_front();
      Pending times = pending_.empty() ? Pending{packet->pts, clock_.next(), clock_.interval()} : pending_.front();
      if (!pending_.empty() && pending_.front().index == packet->pts) pending_.pop_front();
      packet->pts = packet->dts = av_rescale_q(times.time, hundredNanoseconds, stream_->time_base);
      packet->duration = av_rescale_q(times.duration, hundredNanoseconds, stream_->time_base);
    });
  }

  void configureCommon(AVCodecContext* context, UINT32 width, UINT32 height, int64_t bitRate) {
    context->width = static_cast<int>(width);
    context->height = static_cast<int>(height);
    const AVRational rate = clock_.rate();
    context->time_base = av_inv_q(rate);
    context->framerate = rate;
    context->sample_aspect_ratio = {1, 1};
    context->gop_size = std::max(1, 2 * rate.num / rate.den);  // a key frame every two seconds
    context->max_b_frames = 0;
    context->color_primaries = AVCOL_PRI_BT709;
    context->color_trc = AVCOL_TRC_BT709;
    context->colorspace = AVCOL_SPC_BT709;
    context->color_range = AVCOL_RANGE_MPEG;
    if (bitRate > 0) {
      context->bit_rate = bitRate;
      context->rc_max_rate = bitRate;
      context->rc_buffer_size = static_cast<int>(std::min<int64_t>(bitRate, INT32_MAX));  // one second
    }
    if (format_->oformat->flags & AVFMT_GLOBALHEADER) context->flags |= AV_CODEC_FLAG_GLOBAL_HEADER;
  }

  static const char* profileName(UINT32 profile) {
    switch (profile) {
      case eAVEncH264VProfile_Main:
        return "main";
      case eAVEncH264VProfile_High:
        return "high";
      default:
        return "baseline";  // Base and ConstrainedBase, and Media Foundation's default
    }
  }

  // libx264: superfast keeps CABAC, so Main is really Main (ultrafast gives Constrained
  // Baseline whatever is asked), and encodes 1080p well above 30 fps on two cores;
  // zerolatency gives one packet per frame at once (no lookahead, no B-frames).
  bool openX264(UINT32 width, UINT32 height, int64_t bitRate, UINT32 profile) {
    return openSoftwareInput("libx264", width, height, bitRate,
                             {{"preset", "superfast"}, {"tune", "zerolatency"}, {"profile", profileName(profile)}});
  }

  bool openNvenc(UINT32 width, UINT32 height, int64_t bitRate, UINT32 profile) {
    if (access("/dev/nvidiactl", R_OK | W_OK) != 0) return false;
    return openSoftwareInput("h264_nvenc", width, height, bitRate,
                             {{"preset", "p2"}, {"tune", "ll"}, {"zerolatency", "1"}, {"profile", profileName(profile)}});
  }

  // Opens an encoder that takes yuv420p frames from memory, with its private options.
  bool openSoftwareInput(const char* name, UINT32 width, UINT32 height, int64_t bitRate,
                         std::initializer_list<std::pair<const char*, const char*>> settings) {
    const AVCodec* codec = avcodec_find_encoder_by_name(name);
    if (!codec) return false;
    CodecContextPtr context(avcodec_alloc_context3(codec));
    configureCommon(context.get(), width, height, bitRate);
    context->pix_fmt = AV_PIX_FMT_YUV420P;
    context->thread_count = 0;
    AVDictionary* options = nullptr;
    for (const auto& [key, value] : settings) av_dict_set(&options, key, value, 0);
    const int result = avcodec_open2(context.get(), codec, &options);
    av_dict_free(&options);
    if (result < 0) return false;
    context_ = std::move(context);
    return true;
  }

  bool openVaapi(UINT32 width, UINT32 height, int64_t bitRate, UINT32 profile) {
    static const char device[] = "/dev/dri/renderD128";
    const AVCodec* codec = avcodec_find_encoder_by_name("h264_vaapi");
    if (!codec || access(device, R_OK | W_OK) != 0) return false;
    AVBufferRef* created = nullptr;
    if (av_hwdevice_ctx_create(&created, AV_HWDEVICE_TYPE_VAAPI, device, nullptr, 0) < 0) return false;
    BufferRefPtr hwDevice(created);
    BufferRefPtr frames(av_hwframe_ctx_alloc(hwDevice.get()));
    if (!frames) return false;
    auto* framesContext = reinterpret_cast<AVHWFramesContext*>(frames->data);
    framesContext->format = AV_PIX_FMT_VAAPI;
    framesContext->sw_format = AV_PIX_FMT_NV12;
    framesContext->width = static_cast<int>(width);
    framesContext->height = static_cast<int>(height);
    framesContext->initial_pool_size = 8;
    if (av_hwframe_ctx_init(frames.get()) < 0) return false;
    CodecContextPtr context(avcodec_alloc_context3(codec));
    configureCommon(context.get(), width, height, bitRate);
    context->pix_fmt = AV_PIX_FMT_VAAPI;
    context->hw_frames_ctx = av_buffer_ref(frames.get());
    context->profile = profile == eAVEncH264VProfile_Main   ? FF_PROFILE_H264_MAIN
                       : profile == eAVEncH264VProfile_High ? FF_PROFILE_H264_HIGH
                                                            : FF_PROFILE_H264_CONSTRAINED_BASELINE;
    if (avcodec_open2(context.get(), codec, nullptr) < 0) return false;
    context_ = std::move(context);
    hardwareFrames_ = std::move(frames);
    return true;
  }

  InputPicture picture_{};
  int inWidth_ = 0;
  int inHeight_ = 0;
  int stride_ = 0;
  VideoClock clock_;
  int64_t frameIndex_ = 0;
  std::deque<Pending> pending_;
  std::unique_ptr<SwsContext, SwsDeleter> scaler_;
  bool directI420_ = false;
  FramePtr frame_;
  BufferRefPtr hardwareFrames_;
};

// ---- H.264 in, H.264 out ----

// Writes samples that are H.264 already (a camera that encodes its own stream) into the file as
// they are. The parameter sets come from MF_MT_MPEG_SEQUENCE_HEADER (start-code form, as cameras
// send them), on the input type or else the output type; without one the MP4 muxer takes them
// from the first sample, which must then be a key frame that carries them.
class VideoCopy : public StreamEncoder {
 public:
  using StreamEncoder::StreamEncoder;

  HRESULT open(IMFMediaType* output, IMFMediaType* input) {
    UINT32 width = 0, height = 0, inWidth = 0, inHeight = 0;
    if (!getPair(output, MF_MT_FRAME_SIZE, &width, &height) || !width || !height) return MF_E_INVALIDMEDIATYPE;
    if (!getPair(input, MF_MT_FRAME_SIZE, &inWidth, &inHeight) || inWidth != width || inHeight != height)
      return MF_E_INVALIDMEDIATYPE;  // a copy cannot scale
    clock_.open(output, stream_);

    AVCodecParameters* codec = stream_->codecpar;
    codec->codec_type = AVMEDIA_TYPE_VIDEO;
    codec->codec_id = AV_CODEC_ID_H264;
    codec->width = static_cast<int>(width);
    codec->height = static_cast<int>(height);
    codec->sample_aspect_ratio = {1, 1};
    UINT32 size = 0;
    IMFMediaType* withHeader = SUCCEEDED(input->GetBlobSize(MF_MT_MPEG_SEQUENCE_HEADER, &size)) ? input : output;
    if (SUCCEEDED(withHeader->GetBlobSize(MF_MT_MPEG_SEQUENCE_HEADER, &size)) && size > 0) {
      codec->extradata = static_cast<uint8_t*>(av_mallocz(size + AV_INPUT_BUFFER_PADDING_SIZE));
      if (!codec->extradata) return E_OUTOFMEMORY;
      codec->extradata_size = static_cast<int>(size);
      HRESULT hr = withHeader->GetBlob(MF_MT_MPEG_SEQUENCE_HEADER, codec->extradata, size, nullptr);
      if (FAILED(hr)) return hr;
    }
    return S_OK;
  }

  HRESULT write(const uint8_t* data, DWORD length, LONGLONG time, bool hasTime, LONGLONG duration,
                bool hasDuration, bool cleanPoint) override {
    clock_.stamp(time, hasTime, duration, hasDuration);
    if (length == 0) return S_OK;  // nothing to copy
    int result = av_new_packet(packet_.get(), static_cast<int>(length));
    if (result < 0) return fromAv(result);
    std::memcpy(packet_->data, data, length);
    if (cleanPoint) packet_->flags |= AV_PKT_FLAG_KEY;
    // Cameras send no reordered frames, so decoding order is presentation order.
    packet_->pts = packet_->dts = av_rescale_q(time, hundredNanoseconds, stream_->time_base);
    packet_->duration = av_rescale_q(duration, hundredNanoseconds, stream_->time_base);
    HRESULT hr = mux(packet_.get());
    av_packet_unref(packet_.get());
    return hr;
  }

  HRESULT finish() override { return S_OK; }  // nothing is held back

 private:
  VideoClock clock_;
};

// ---- AAC ----

bool inputSamples(REFGUID subtype, UINT32 bits, AVSampleFormat* format) {
  if (subtype == MFAudioFormat_Float) {
    if (bits == 32) *format = AV_SAMPLE_FMT_FLT;
    else if (bits == 64) *format = AV_SAMPLE_FMT_DBL;
    else return false;
  } else if (subtype == MFAudioFormat_PCM) {
    if (bits == 8) *format = AV_SAMPLE_FMT_U8;
    else if (bits == 16) *format = AV_SAMPLE_FMT_S16;
    else if (bits == 24 || bits == 32) *format = AV_SAMPLE_FMT_S32;  // 24-bit samples are widened first
    else return false;
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
    const UINT32 rate = get32(output, MF_MT_AUDIO_SAMPLES_PER_SECOND, 0);
    const UINT32 channels = get32(output, MF_MT_AUDIO_NUM_CHANNELS, 0);
    const UINT32 inRate = get32(input, MF_MT_AUDIO_SAMPLES_PER_SECOND, 0);
    const UINT32 inChannels = get32(input, MF_MT_AUDIO_NUM_CHANNELS, 0);
    bits_ = get32(input, MF_MT_AUDIO_BITS_PER_SAMPLE, 0);
    if (!rate || !channels || !inRate || !inChannels || !bits_) return MF_E_INVALIDMEDIATYPE;
    if (!inputSamples(getGuid(input, MF_MT_SUBTYPE), bits_, &inFormat_)) return MF_E_INVALIDMEDIATYPE;
    blockAlign_ = get32(input, MF_MT_AUDIO_BLOCK_ALIGNMENT, inChannels * bits_ / 8);
    if (blockAlign_ < inChannels * bits_ / 8) return MF_E_INVALIDMEDIATYPE;
    inChannels_ = inChannels;

    const AVCodec* codec = avcodec_find_encoder(AV_CODEC_ID_AAC);
    if (!codec) return MF_E_INVALIDMEDIATYPE;
    const UINT32 mask = get32(input, MF_MT_AUDIO_CHANNEL_MASK, 0);
    channelLayout(mask, inChannels, &inLayout_);
    // The output keeps the input's layout when the encoder takes it, else the encoder's layout
    // of the same channel count.
    channelLayout(channels == inChannels ? mask : 0, channels, &outLayout_);
    if (codec->ch_layouts) {
      const AVChannelLayout* chosen = nullptr;
      for (const AVChannelLayout* l = codec->ch_layouts; l->nb_channels; ++l) {
        if (!av_channel_layout_compare(l, &outLayout_)) {
          chosen = l;
          break;
        }
        if (!chosen && l->nb_channels == static_cast<int>(channels)) chosen = l;
      }
      if (!chosen) return MF_E_INVALIDMEDIATYPE;
      av_channel_layout_uninit(&outLayout_);
      av_channel_layout_copy(&outLayout_, chosen);
    }

    CodecContextPtr context(avcodec_alloc_context3(codec));
    context->sample_fmt = AV_SAMPLE_FMT_FLTP;
    context->sample_rate = static_cast<int>(rate);
    av_channel_layout_copy(&context->ch_layout, &outLayout_);
    const UINT32 bytesPerSecond = get32(output, MF_MT_AUDIO_AVG_BYTES_PER_SECOND, 16000);
    context->bit_rate = static_cast<int64_t>(bytesPerSecond) * 8;
    context->time_base = {1, static_cast<int>(rate)};
    if (format_->oformat->flags & AVFMT_GLOBALHEADER) context->flags |= AV_CODEC_FLAG_GLOBAL_HEADER;
    if (avcodec_open2(context.get(), codec, nullptr) < 0) return MF_E_INVALIDMEDIATYPE;
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

// ---- the writer ----

struct StreamSlot {
  ComPtr<IMFMediaType> output;
  ComPtr<IMFMediaType> input;
  AVStream* stream = nullptr;
  std::unique_ptr<StreamEncoder> encoder;
  MF_SINK_WRITER_STATISTICS statistics{};
};

const char* muxerOf(REFGUID container) {
  if (container == MFTranscodeContainerType_MPEG4 || container == MFTranscodeContainerType_FMPEG4) return "mp4";
  if (container == MFTranscodeContainerType_3GP) return "3gp";
  if (container == MFTranscodeContainerType_ADTS) return "adts";
  if (container == MFTranscodeContainerType_MP3) return "mp3";
  if (container == MFTranscodeContainerType_WAVE) return "wav";
  if (container == MFTranscodeContainerType_ASF) return "asf";
  if (container == MFTranscodeContainerType_AC3) return "ac3";
  if (container == MFTranscodeContainerType_AMR) return "amr";
  if (container == MFTranscodeContainerType_MPEG2) return "mpegts";
  return nullptr;
}

class SinkWriter : public ComObject<IMFSinkWriter, IID_IMFSinkWriter> {
 public:
  SinkWriter(AVFormatContext* format, std::unique_ptr<Mp4File> file, bool hardware, bool fragmented)
      : format_(format), file_(std::move(file)), hardware_(hardware), fragmented_(fragmented) {}

  ~SinkWriter() override {
    for (StreamSlot& slot : streams_) slot.encoder.reset();  // before the muxer they write into
    if (format_) {
      format_->pb = nullptr;  // the file's own; an unfinished file stays as it is, as when Windows drops a writer
      avformat_free_context(format_);
    }
  }

  HRESULT AddStream(IMFMediaType* target, DWORD* streamIndex) override {
    if (!target || !streamIndex) return E_INVALIDARG;
    std::lock_guard<std::mutex> lock(mutex_);
    if (state_ != State::configuring) return MF_E_INVALIDREQUEST;
    const GUID major = getGuid(target, MF_MT_MAJOR_TYPE), subtype = getGuid(target, MF_MT_SUBTYPE);
    UINT32 width = 0, height = 0;
    const bool video = major == MFMediaType_Video && subtype == MFVideoFormat_H264 &&
                       getPair(target, MF_MT_FRAME_SIZE, &width, &height) && width && height;
    const bool audio = major == MFMediaType_Audio && subtype == MFAudioFormat_AAC &&
                       get32(target, MF_MT_AUDIO_SAMPLES_PER_SECOND, 0) && get32(target, MF_MT_AUDIO_NUM_CHANNELS, 0);
    if (!video && !audio) return MF_E_INVALIDMEDIATYPE;
    AVStream* stream = avformat_new_stream(format_, nullptr);
    if (!stream) return E_OUTOFMEMORY;
    StreamSlot slot;
    slot.output = target;
    slot.stream = stream;
    streams_.push_back(std::move(slot));
    *streamIndex = static_cast<DWORD>(streams_.size() - 1);
    return S_OK;
  }

  HRESULT SetInputMediaType(DWORD streamIndex, IMFMediaType* input, IMFAttributes*) override {
    if (!input) return E_INVALIDARG;
    std::lock_guard<std::mutex> lock(mutex_);
    if (streamIndex >= streams_.size()) return MF_E_INVALIDSTREAMNUMBER;
    if (state_ != State::configuring) return MF_E_INVALIDREQUEST;
    StreamSlot& slot = streams_[streamIndex];
    const GUID outMajor = getGuid(slot.output.Get(), MF_MT_MAJOR_TYPE);
    if (getGuid(input, MF_MT_MAJOR_TYPE) != outMajor) return MF_E_INVALIDMEDIATYPE;
    HRESULT hr;
    std::unique_ptr<StreamEncoder> encoder;
    if (outMajor == MFMediaType_Video && getGuid(input, MF_MT_SUBTYPE) == MFVideoFormat_H264) {
      auto copy = std::make_unique<VideoCopy>(format_, slot.stream, file_.get());
      hr = copy->open(slot.output.Get(), input);
      encoder = std::move(copy);
    } else if (outMajor == MFMediaType_Video) {
      auto video = std::make_unique<VideoEncoder>(format_, slot.stream, file_.get());
      hr = video->open(slot.output.Get(), input, hardware_);
      encoder = std::move(video);
    } else {
      auto audio = std::make_unique<AudioEncoder>(format_, slot.stream, file_.get());
      hr = audio->open(slot.output.Get(), input);
      encoder = std::move(audio);
    }
    if (FAILED(hr)) return hr;
    slot.encoder = std::move(encoder);
    slot.input = input;
    return S_OK;
  }

  HRESULT BeginWriting() override {
    std::lock_guard<std::mutex> lock(mutex_);
    if (state_ != State::configuring || streams_.empty()) return MF_E_INVALIDREQUEST;
    for (const StreamSlot& slot : streams_)
      if (!slot.encoder) return MF_E_TRANSFORM_TYPE_NOT_SET;
    AVDictionary* options = nullptr;
    if (fragmented_) {
      // The header waits for the first fragment (delay_moov) so that a stream whose parameter
      // sets come with its first key frame has them in the header too.
      av_dict_set(&options, "movflags", "empty_moov+delay_moov+default_base_moof", 0);
      av_dict_set(&options, "frag_duration", "900000", 0);
    }
    av_dict_set(&options, "flush_packets", "1", 0);
    const int result = avformat_write_header(format_, &options);
    av_dict_free(&options);
    if (result < 0) return result == AVERROR(EINVAL) ? MF_E_INVALIDMEDIATYPE : fromAv(result);
    avio_flush(format_->pb);
    file_->commit();
    state_ = State::writing;
    return S_OK;
  }

  HRESULT WriteSample(DWORD streamIndex, IMFSample* sample) override {
    if (!sample) return E_INVALIDARG;
    std::lock_guard<std::mutex> lock(mutex_);
    if (streamIndex >= streams_.size()) return MF_E_INVALIDSTREAMNUMBER;
    if (state_ != State::writing) return MF_E_INVALIDREQUEST;
    StreamSlot& slot = streams_[streamIndex];
    LONGLONG time = 0, duration = 0;
    const bool hasTime = SUCCEEDED(sample->GetSampleTime(&time));
    const bool hasDuration = SUCCEEDED(sample->GetSampleDuration(&duration));
    ComPtr<IMFMediaBuffer> buffer;
    HRESULT hr;
    DWORD count = 0;
    sample->GetBufferCount(&count);
    BYTE* data = nullptr;
    DWORD length = 0;
    if (count > 0) {
      hr = sample->ConvertToContiguousBuffer(buffer.GetAddressOf());
      if (FAILED(hr)) return hr;
      hr = buffer->Lock(&data, nullptr, &length);
      if (FAILED(hr)) return hr;
    }
    hr = slot.encoder->write(data, length, time, hasTime, duration, hasDuration,
                             get32(sample, MFSampleExtension_CleanPoint, FALSE) != FALSE);
    if (buffer) buffer->Unlock();
    MF_SINK_WRITER_STATISTICS& s = slot.statistics;
    ++s.qwNumSamplesReceived;
    if (hasTime) s.llLastTimestampReceived = s.llLastTimestampEncoded = s.llLastTimestampProcessed = time;
    if (SUCCEEDED(hr)) {
      ++s.qwNumSamplesEncoded;
      ++s.qwNumSamplesProcessed;
      s.qwByteCountProcessed += length;
    }
    return hr;
  }

  HRESULT SendStreamTick(DWORD streamIndex, LONGLONG timestamp) override {
    std::lock_guard<std::mutex> lock(mutex_);
    if (streamIndex >= streams_.size()) return MF_E_INVALIDSTREAMNUMBER;
    if (state_ != State::writing) return MF_E_INVALIDREQUEST;
    ++streams_[streamIndex].statistics.qwNumStreamTicksReceived;
    streams_[streamIndex].statistics.llLastStreamTickReceived = timestamp;
    return S_OK;  // a gap needs no marker here: the next sample's time opens it
  }

  // Markers are answered through the asynchronous callback, which this writer does not offer.
  HRESULT PlaceMarker(DWORD streamIndex, LPVOID) override {
    std::lock_guard<std::mutex> lock(mutex_);
    if (streamIndex >= streams_.size()) return MF_E_INVALIDSTREAMNUMBER;
    return MF_E_INVALIDREQUEST;
  }



  HRESULT Finalize() override {
    std::lock_guard<std::mutex> lock(mutex_);
    if (state_ != State::writing) return MF_E_INVALIDREQUEST;
    state_ = State::finalized;
    HRESULT hr = S_OK;
    for (StreamSlot& slot : streams_) {
      HRESULT drained = slot.encoder->finish();
      if (SUCCEEDED(hr)) hr = drained;
    }
    bool anyPackets = false;
    for (const StreamSlot& slot : streams_) anyPackets = anyPackets || slot.encoder->packets() > 0;
    int trailer = av_write_trailer(format_);
    avio_flush(format_->pb);
    if (trailer >= 0 && format_->pb->error < 0) trailer = format_->pb->error;
    if (trailer < 0) {
      file_->rollback();
    } else {
      for (size_t i = 0; i < streams_.size(); ++i) file_->setTrackEnd(i, streams_[i].encoder->end());
      file_->stampDurations();
    }
    const int closed = file_->close();
    if (SUCCEEDED(hr)) hr = fromAv(trailer < 0 ? trailer : closed);
    if (SUCCEEDED(hr) && !anyPackets) hr = MF_E_SINK_NO_SAMPLES_PROCESSED;
    return hr;
  }


  HRESULT GetStatistics(DWORD streamIndex, MF_SINK_WRITER_STATISTICS* stats) override {
    if (!stats) return E_INVALIDARG;
    std::lock_guard<std::mutex> lock(mutex_);
    if (stats->cb != sizeof(MF_SINK_WRITER_STATISTICS)) return E_INVALIDARG;
    if (streamIndex == MF_SINK_WRITER_ALL_STREAMS || streamIndex >= streams_.size()) return MF_E_INVALIDSTREAMNUMBER;
    *stats = streams_[streamIndex].statistics;
    stats->cb = sizeof(MF_SINK_WRITER_STATISTICS);
    return S_OK;
  }

 private:
  enum class State { configuring, writing, finalized };

  std::mutex mutex_;
  AVFormatContext* format_;
  std::unique_ptr<Mp4File> file_;
  const bool hardware_;
  const bool fragmented_;
  State state_ = State::configuring;
  std::vector<StreamSlot> streams_;
};

}  // namespace

}  // namespace platform

HRESULT MFCreateSinkWriterFromURL(LPCWSTR url, IMFByteStream* byteStream, IMFAttributes* attributes,
                                  IMFSinkWriter** sinkWriter) {
  if (!sinkWriter) return E_POINTER;
  *sinkWriter = nullptr;
  if (!url || byteStream) return E_INVALIDARG;  // writing into a byte stream is not offered here
  if (!platform::mediaFoundationStarted()) return MF_E_PLATFORM_NOT_INITIALIZED;
  platform::quietenLogging();

  const std::string path = platform::narrow(url);
  const GUID container = platform::getGuid(attributes, MF_TRANSCODE_CONTAINERTYPE);
  const char* muxer = platform::muxerOf(container);
  const AVOutputFormat* output = muxer ? av_guess_format(muxer, nullptr, nullptr) : nullptr;
  if (!output && container == GUID_NULL) output = av_guess_format(nullptr, path.c_str(), nullptr);
  if (!output) return MF_E_UNSUPPORTED_BYTESTREAM_TYPE;

  // The file is created now, as on Windows, so a bad path fails here with the system's code.
  if (path.empty()) return HRESULT_FROM_WIN32(ERROR_PATH_NOT_FOUND);
  auto file = std::make_unique<platform::Mp4File>(path);
  if (!file->io()) return platform::fromErrno(file->error());
  AVFormatContext* format = nullptr;
  if (avformat_alloc_output_context2(&format, output, nullptr, path.c_str()) < 0 || !format) return E_OUTOFMEMORY;
  format->pb = file->io();
  format->flags |= AVFMT_FLAG_CUSTOM_IO;
  const bool hardware = platform::get32(attributes, MF_READWRITE_ENABLE_HARDWARE_TRANSFORMS, 0) != 0;
  const bool mp4 = std::strcmp(output->name, "mp4") == 0;
  *sinkWriter = new platform::SinkWriter(format, std::move(file), hardware, mp4);
  return S_OK;
}
