// H.264 from pictures: libx264, or a hardware encoder when hardware transforms are allowed and
// one opens. Four-byte RGB at the output's size goes through our own converter, anything else
// through swscale.
#include <unistd.h>

#include <cstring>
#include <deque>
#include <initializer_list>

extern "C" {
#include <libavutil/hwcontext.h>
#include <libavutil/opt.h>
}

#include "platform/linux/ffmpeg/colorconvert.h"
#include "platform/linux/ffmpeg/evenpicture.h"
#include "platform/linux/ffmpeg/streamencoder.h"

namespace platform::sinkwriter {

namespace {

struct InputPicture {
  AVPixelFormat format;
  int bytesPerPixel;  // of the first plane's packed pixels; 0 for planar YUV
  bool bottomUpByDefault;
};

bool inputPicture(REFGUID subtype, InputPicture* picture) {
  // Media Foundation's RGB32 and ARGB32 lie in memory as B, G, R, X/A; RGB24 as B, G, R.
  if (subtype == MFVideoFormat_RGB32)
    *picture = {AV_PIX_FMT_BGR0, 4, true};
  else if (subtype == MFVideoFormat_ARGB32)
    *picture = {AV_PIX_FMT_BGRA, 4, true};
  else if (subtype == MFVideoFormat_RGB24)
    *picture = {AV_PIX_FMT_BGR24, 3, true};
  else if (subtype == MFVideoFormat_NV12)
    *picture = {AV_PIX_FMT_NV12, 0, false};
  else if (subtype == MFVideoFormat_YUY2)
    *picture = {AV_PIX_FMT_YUYV422, 2, false};
  else if (subtype == MFVideoFormat_I420 || subtype == MFVideoFormat_IYUV)
    *picture = {AV_PIX_FMT_YUV420P, 0, false};
  else
    return false;
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

    // 4:2:0 encoders take no odd sizes: an odd picture is encoded at the next even size, its
    // last column and row repeated into the added ones.
    width_ = static_cast<int>(width);
    height_ = static_cast<int>(height);
    const auto codedWidth = static_cast<UINT32>(evenpicture::evenSize(width_));
    const auto codedHeight = static_cast<UINT32>(evenpicture::evenSize(height_));
    bool opened = false;
    if (hardware)
      opened =
          openNvenc(codedWidth, codedHeight, bitRate, profile) || openVaapi(codedWidth, codedHeight, bitRate, profile);
    if (!opened && !openX264(codedWidth, codedHeight, bitRate, profile)) return MF_E_INVALIDMEDIATYPE;

    const AVPixelFormat target = hardwareFrames_ ? AV_PIX_FMT_NV12 : context_->pix_fmt;
    const bool sameSize = inWidth_ == static_cast<int>(width) && inHeight_ == static_cast<int>(height);
    if (picture_.bytesPerPixel == 4 && target == AV_PIX_FMT_YUV420P && sameSize) {
      // Four-byte RGB at the output's size is the display path: our own one-pass converter
      // costs a fraction of swscale's, which matters at 60 frames a second.
      conversion_ = Conversion::bgrxToI420;
    } else if (picture_.format == AV_PIX_FMT_YUV420P && target == AV_PIX_FMT_YUV420P && sameSize &&
               codedWidth == width && codedHeight == height && std::strcmp(context_->codec->name, "libx264") == 0) {
      // I420 at the output's size is the camera path: libx264 copies each picture into its own
      // frames while it is handed over, so it can read the caller's planes where they lie.
      conversion_ = Conversion::borrowI420;
    } else {
      scaler_.reset(sws_getContext(inWidth_, inHeight_, picture_.format, static_cast<int>(width),
                                   static_cast<int>(height), target, SWS_BILINEAR, nullptr, nullptr, nullptr));
      if (!scaler_) return MF_E_INVALIDMEDIATYPE;
      // BT.709, limited range, as the stream declares.
      int* table = const_cast<int*>(sws_getCoefficients(SWS_CS_ITU709));
      sws_setColorspaceDetails(scaler_.get(), table, 1, table, 0, 0, 1 << 16, 1 << 16);
    }

    if (conversion_ != Conversion::borrowI420) {
      frame_.reset(av_frame_alloc());
      frame_->format = target;
      frame_->width = context_->width;
      frame_->height = context_->height;
      if (av_frame_get_buffer(frame_.get(), 0) < 0) return E_OUTOFMEMORY;
    }
    return describe();
  }

  HRESULT write(const uint8_t* data, DWORD length, LONGLONG time, bool hasTime, LONGLONG duration, bool hasDuration,
                bool) override {
    clock_.stamp(time, hasTime, duration, hasDuration);
    if (static_cast<int64_t>(length) < requiredLength()) return MF_E_BUFFERTOOSMALL;

    const uint8_t* planes[4] = {};
    int strides[4] = {};
    sourcePlanes(data, planes, strides);
    int result = 0;
    FramePtr borrowed;
    if (conversion_ == Conversion::borrowI420) {
      if ((result = borrow(data, length, planes, strides, &borrowed)) < 0) return fromAv(result);
    } else if ((result = av_frame_make_writable(frame_.get())) < 0) {
      return fromAv(result);
    } else if (conversion_ == Conversion::bgrxToI420) {
      colour::bgrxToI420(planes[0], strides[0], inWidth_, inHeight_, frame_->data[0], frame_->linesize[0],
                         frame_->data[1], frame_->linesize[1], frame_->data[2], frame_->linesize[2]);
    } else {
      sws_scale(scaler_.get(), planes, strides, 0, inHeight_, frame_->data, frame_->linesize);
    }
    // Both conversions give an odd picture's chroma its last half-filled column and row already.
    if (!borrowed && (frame_->width != width_ || frame_->height != height_))
      evenpicture::repeatEdges(frame_->data[0], frame_->linesize[0], width_, height_);
    AVFrame* send = borrowed ? borrowed.get() : frame_.get();

    // The encoder counts frames at the declared rate; the packets get the samples' own times back.
    send->pts = frameIndex_++;
    pending_.push_back({send->pts, time, duration});
    FramePtr uploaded;
    if (hardwareFrames_) {
      uploaded.reset(av_frame_alloc());
      if ((result = av_hwframe_get_buffer(hardwareFrames_.get(), uploaded.get(), 0)) < 0 ||
          (result = av_hwframe_transfer_data(uploaded.get(), send, 0)) < 0)
        return fromAv(result);
      uploaded->pts = send->pts;
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

  // A frame over the caller's planes. Its buffer frees nothing: the caller's memory is only read
  // while the frame is handed over, and libx264 keeps no reference past that.
  int borrow(const uint8_t* data, DWORD length, const uint8_t* const* planes, const int* strides,
             FramePtr* borrowed) const {
    FramePtr frame(av_frame_alloc());
    if (!frame) return AVERROR(ENOMEM);
    frame->format = AV_PIX_FMT_YUV420P;
    frame->width = inWidth_;
    frame->height = inHeight_;
    for (int plane = 0; plane < 3; ++plane) {
      frame->data[plane] = const_cast<uint8_t*>(planes[plane]);
      frame->linesize[plane] = strides[plane];
    }
    frame->buf[0] = av_buffer_create(
        const_cast<uint8_t*>(data), length, [](void*, uint8_t*) {}, nullptr, AV_BUFFER_FLAG_READONLY);
    if (!frame->buf[0]) return AVERROR(ENOMEM);
    *borrowed = std::move(frame);
    return 0;
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
      case eAVEncH264VProfile_Main: return "main";
      case eAVEncH264VProfile_High: return "high";
      default: return "baseline";  // Base and ConstrainedBase, and Media Foundation's default
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
    return openSoftwareInput(
        "h264_nvenc", width, height, bitRate,
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
  int width_ = 0;  // the picture's size; the encoder's is the next even one
  int height_ = 0;
  int inWidth_ = 0;
  int inHeight_ = 0;
  int stride_ = 0;
  VideoClock clock_;
  int64_t frameIndex_ = 0;
  std::deque<Pending> pending_;
  std::unique_ptr<SwsContext, SwsDeleter> scaler_;
  // How a picture becomes the encoder's: swscale, our converter, or handed over where it lies.
  enum class Conversion { swscale, bgrxToI420, borrowI420 } conversion_ = Conversion::swscale;
  FramePtr frame_;
  BufferRefPtr hardwareFrames_;
};

}  // namespace

HRESULT openVideoEncoder(AVFormatContext* format, AVStream* stream, Mp4File* file, IMFMediaType* output,
                         IMFMediaType* input, bool hardware, std::unique_ptr<StreamEncoder>* encoder) {
  return openStream<VideoEncoder>(format, stream, file, encoder, output, input, hardware);
}

}  // namespace platform::sinkwriter
