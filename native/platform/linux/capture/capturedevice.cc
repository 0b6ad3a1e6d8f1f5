#include "platform/linux/capture/capturedevice.h"

#include <fcntl.h>
#include <linux/videodev2.h>
#include <sys/ioctl.h>
#include <unistd.h>

extern "C" {
#include <libavdevice/avdevice.h>
#include <libavutil/opt.h>
}

#include <algorithm>
#include <cmath>
#include <optional>

#include "platform/linux/ffmpeg/avlog.h"
#include "platform/linux/com.h"
#include "platform/linux/mf/mfattributes.h"
#include "platform/linux/mfcapture.h"

namespace platform::capturedevice {

// What an H.264 webcam does inside, for test cameras: their lavfi pictures are encoded with
// libx264 before anything else sees them, one packet per picture, a key frame every second and
// at once when asked, the parameter sets both in the codec parameters and before every key frame.
class DeviceEncoder {
 public:
  ~DeviceEncoder() {
    avcodec_free_context(&pictures_);
    avcodec_free_context(&encoder_);
    av_frame_free(&frame_);
    av_packet_free(&packet_);
  }

  HRESULT open(const AVStream* stream, AVRational rate) {
    const AVCodec* raw = avcodec_find_decoder(stream->codecpar->codec_id);
    const AVCodec* x264 = avcodec_find_encoder_by_name("libx264");
    if (!raw || !x264) return MF_E_TOPO_CODEC_NOT_FOUND;
    pictures_ = avcodec_alloc_context3(raw);
    encoder_ = avcodec_alloc_context3(x264);
    frame_ = av_frame_alloc();
    packet_ = av_packet_alloc();
    if (!pictures_ || !encoder_ || !frame_ || !packet_) return E_OUTOFMEMORY;
    avcodec_parameters_to_context(pictures_, stream->codecpar);
    if (avcodec_open2(pictures_, raw, nullptr) < 0) return MF_E_TOPO_CODEC_NOT_FOUND;
    encoder_->width = stream->codecpar->width;
    encoder_->height = stream->codecpar->height;
    encoder_->pix_fmt = AV_PIX_FMT_YUV420P;
    encoder_->sample_aspect_ratio = stream->codecpar->sample_aspect_ratio;
    encoder_->time_base = stream->time_base;  // the packets keep the pictures' times
    encoder_->framerate = rate;
    encoder_->gop_size = std::max(1, static_cast<int>(std::lround(av_q2d(rate))));
    encoder_->max_b_frames = 0;
    encoder_->thread_count = 1;
    encoder_->flags |= AV_CODEC_FLAG_GLOBAL_HEADER;
    // libx264 tells its settings and statistics at the information level; a camera keeps quiet.
    encoder_->log_level_offset = AV_LOG_VERBOSE - AV_LOG_INFO;
    AVDictionary* options = nullptr;
    av_dict_set(&options, "preset", "superfast", 0);
    av_dict_set(&options, "tune", "zerolatency", 0);
    av_dict_set(&options, "profile", "main", 0);
    av_dict_set(&options, "forced-idr", "1", 0);
    av_dict_set(&options, "x264-params", "repeat-headers=1", 0);
    const int opened = avcodec_open2(encoder_, x264, &options);
    av_dict_free(&options);
    return opened < 0 ? MF_E_TOPO_CODEC_NOT_FOUND : S_OK;
  }

  const AVCodecContext* context() const { return encoder_; }
  void requestKeyFrame() { keyFrameWanted_ = true; }

  // Encodes the pictures of one lavfi packet and hands each H.264 packet to deliver.
  template <class Deliver>
  void encode(const AVPacket* packet, Deliver deliver) {
    if (avcodec_send_packet(pictures_, packet) < 0) return;
    while (avcodec_receive_frame(pictures_, frame_) >= 0) {
      // Decoded raw pictures call themselves intra pictures; only a request makes a key frame.
      frame_->pict_type = keyFrameWanted_ ? AV_PICTURE_TYPE_I : AV_PICTURE_TYPE_NONE;
      keyFrameWanted_ = false;
      const int sent = avcodec_send_frame(encoder_, frame_);
      av_frame_unref(frame_);
      if (sent < 0) return;
      while (avcodec_receive_packet(encoder_, packet_) >= 0) {
        deliver(packet_);
        av_packet_unref(packet_);
      }
    }
  }

 private:
  AVCodecContext* pictures_ = nullptr;
  AVCodecContext* encoder_ = nullptr;
  AVFrame* frame_ = nullptr;
  AVPacket* packet_ = nullptr;
  bool keyFrameWanted_ = false;
};

Input::Input() = default;

Input::~Input() {
  avcodec_free_context(&decoder);
  avcodec_parameters_free(&delivered);
  avformat_close_input(&format);
}

void Input::deliver(AVPacket* packet, const std::function<void(AVPacket*)>& to) {
  if (encoder)
    encoder->encode(packet, to);
  else
    to(packet);
}

namespace {

GUID videoSubtype(const AVCodecParameters* codec) {
  if (codec->codec_id == AV_CODEC_ID_MJPEG) return MFVideoFormat_MJPG;
  if (codec->codec_id == AV_CODEC_ID_H264) return MFVideoFormat_H264;
  switch (codec->format) {
    case AV_PIX_FMT_YUYV422: return MFVideoFormat_YUY2;
    case AV_PIX_FMT_NV12: return MFVideoFormat_NV12;
    case AV_PIX_FMT_YUV420P: return MFVideoFormat_I420;
    case AV_PIX_FMT_BGR0:
    case AV_PIX_FMT_BGRA: return MFVideoFormat_RGB32;
    case AV_PIX_FMT_BGR24: return MFVideoFormat_RGB24;
    default: return MFVideoFormat_YUY2;  // the engine converts whatever else the device sends
  }
}

// Raw pictures and PCM sound are fully described by what the device reports on opening. Probing
// such a stream reads its first packets: it waits for a camera that is still warming up (or for
// ever, for one that streams nothing) and for a microphone that sends seconds at once.
bool describedOnOpening(const AVCodecParameters* codec) {
  if (codec->codec_type == AVMEDIA_TYPE_VIDEO)
    return codec->codec_id == AV_CODEC_ID_RAWVIDEO && codec->width > 0 && codec->height > 0 &&
           codec->format != AV_PIX_FMT_NONE;
  return codec->codec_type == AVMEDIA_TYPE_AUDIO && codec->codec_id == AV_CODEC_ID_PCM_S16LE &&
         codec->sample_rate > 0 && codec->ch_layout.nb_channels > 0;
}

// The frame rate a device declares: the stream's, else the one its time base counts (a test
// camera's graph), else the one it was found with.
AVRational declaredRate(const AVStream* stream, AVRational found) {
  if (stream->avg_frame_rate.num > 0 && stream->avg_frame_rate.den > 0) return stream->avg_frame_rate;
  if (stream->r_frame_rate.num > 0 && stream->r_frame_rate.den > 0) return stream->r_frame_rate;
  const AVRational ticks = av_inv_q(stream->time_base);
  if (ticks.num > 0 && ticks.den > 0 && av_cmp_q(ticks, AVRational{240, 1}) <= 0) return ticks;
  return found;
}

}  // namespace

HRESULT openInput(Device& device, std::shared_ptr<Input>& result) {
  auto input = std::make_shared<Input>();
  const AVInputFormat* format = av_find_input_format(device.formatName.c_str());
  if (!format) return MF_E_NO_CAPTURE_DEVICES_AVAILABLE;
  AVDictionary* options = nullptr;
  std::string url = device.url;
  if (device.formatName == "pulse") {
    // A microphone whose source is gone would be connected to the default one instead.
    input->watch = std::make_unique<pulse::SourceWatch>(device.url);
    if (!input->watch->present()) return MF_E_AUDIO_RECORDING_DEVICE_INVALIDATED;
    av_dict_set_int(&options, "sample_rate", device.rate, 0);
    av_dict_set_int(&options, "channels", device.channels, 0);
    // 20 ms fragments: the server's default is a buffer of seconds, far too late for peaks.
    av_dict_set_int(&options, "fragment_size", device.rate * device.channels * 2 / 50, 0);
  } else if (device.formatName == "lavfi") {
    // Test cameras look like a YUY2 webcam (or hand their encoder the planar pictures it takes)
    // and run at their frame rate, not as fast as possible.
    url += device.encodesH264 ? ",format=yuv420p,realtime" : ",format=yuyv422,realtime";
  }
  const bool fallback = device.formatName == "lavfi" && !device.encodesH264;
  int error;
  {
    std::optional<ffmpeg::QuietLog> quiet;
    if (fallback) quiet.emplace();  // a graph that cannot make YUY2 is tried again below
    error = avformat_open_input(&input->format, url.c_str(), format, &options);
  }
  if (error < 0 && fallback) {
    // Some generators cannot make 4:2:2 pictures one pixel wide: such a camera sends BGRA.
    url = device.url + ",format=bgra,realtime";
    error = avformat_open_input(&input->format, url.c_str(), format, &options);
  }
  av_dict_free(&options);
  if (error < 0 || (input->watch && !input->watch->present()))
    return device.video ? MF_E_VIDEO_RECORDING_DEVICE_INVALIDATED : MF_E_AUDIO_RECORDING_DEVICE_INVALIDATED;
  const bool described = input->format->nb_streams == 1 && describedOnOpening(input->format->streams[0]->codecpar);
  if (!described && avformat_find_stream_info(input->format, nullptr) < 0) return MF_E_INVALID_STREAM_DATA;
  input->stream =
      av_find_best_stream(input->format, device.video ? AVMEDIA_TYPE_VIDEO : AVMEDIA_TYPE_AUDIO, -1, -1, nullptr, 0);
  if (input->stream < 0)
    return device.video ? MF_E_CAPTURE_SOURCE_NO_VIDEO_STREAM_PRESENT : MF_E_CAPTURE_SOURCE_NO_AUDIO_STREAM_PRESENT;
  AVStream* stream = input->format->streams[input->stream];
  const AVRational rate = declaredRate(stream, device.current.rate);
  input->delivered = avcodec_parameters_alloc();
  if (!input->delivered) return E_OUTOFMEMORY;
  if (device.encodesH264) {
    input->encoder = std::make_unique<DeviceEncoder>();
    HRESULT hr = input->encoder->open(stream, rate);
    if (FAILED(hr)) return hr;
    avcodec_parameters_from_context(input->delivered, input->encoder->context());
    input->timeBase = input->encoder->context()->time_base;
  } else {
    avcodec_parameters_copy(input->delivered, stream->codecpar);
    input->timeBase = stream->time_base;
  }
  const AVCodecParameters* delivered = input->delivered;
  const AVCodec* codec = avcodec_find_decoder(delivered->codec_id);
  if (!codec) return MF_E_TOPO_CODEC_NOT_FOUND;
  input->decoder = avcodec_alloc_context3(codec);
  if (!input->decoder) return E_OUTOFMEMORY;
  avcodec_parameters_to_context(input->decoder, delivered);
  input->decoder->thread_count = 1;
  if (avcodec_open2(input->decoder, codec, nullptr) < 0) return MF_E_TOPO_CODEC_NOT_FOUND;

  DeviceFormat& current = device.current;
  if (device.video) {
    current.subtype = videoSubtype(delivered);
    current.width = delivered->width;
    current.height = delivered->height;
    current.rate = rate;
    if (delivered->sample_aspect_ratio.num > 0) current.aspect = delivered->sample_aspect_ratio;
  } else {
    current.subtype = MFAudioFormat_PCM;
    current.sampleRate = delivered->sample_rate;
    current.channels = delivered->ch_layout.nb_channels;
  }
  result = std::move(input);
  return S_OK;
}

// Asks a device that encodes H.264 for a key frame at its next picture. Test cameras always
// oblige; a V4L2 camera does when its driver offers the force-key-frame control, and otherwise
// the recording starts at the camera's next key frame.
void requestKeyFrame(Device& device) {
  if (!device.input) return;
  if (device.input->encoder) {
    device.input->encoder->requestKeyFrame();
  } else if (device.formatName == "v4l2") {
    // Controls can be set through any open handle of the node, also while another one streams.
    const int fd = ::open(device.url.c_str(), O_RDWR | O_NONBLOCK | O_CLOEXEC);
    if (fd < 0) return;
    v4l2_control control{};
    control.id = V4L2_CID_MPEG_VIDEO_FORCE_KEY_FRAME;
    ::ioctl(fd, VIDIOC_S_CTRL, &control);
    ::close(fd);
  }
}

HRESULT makeDeviceType(const Device& device, IMFMediaType** type) {
  ComPtr<IMFMediaType> made;
  HRESULT hr = MFCreateMediaType(made.GetAddressOf());
  if (FAILED(hr)) return hr;
  const DeviceFormat& f = device.current;
  if (device.video) {
    hr = made->SetGUID(MF_MT_MAJOR_TYPE, MFMediaType_Video);
    if (SUCCEEDED(hr)) hr = made->SetGUID(MF_MT_SUBTYPE, f.subtype);
    if (SUCCEEDED(hr)) hr = MFSetAttributeSize(made.Get(), MF_MT_FRAME_SIZE, f.width, f.height);
    if (SUCCEEDED(hr)) hr = MFSetAttributeRatio(made.Get(), MF_MT_FRAME_RATE, f.rate.num, f.rate.den);
    if (SUCCEEDED(hr)) hr = MFSetAttributeRatio(made.Get(), MF_MT_PIXEL_ASPECT_RATIO, f.aspect.num, f.aspect.den);
    if (SUCCEEDED(hr)) hr = made->SetUINT32(MF_MT_INTERLACE_MODE, MFVideoInterlace_Progressive);
    if (SUCCEEDED(hr) && f.subtype != MFVideoFormat_MJPG && f.subtype != MFVideoFormat_H264)
      hr = made->SetUINT32(MF_MT_ALL_SAMPLES_INDEPENDENT, TRUE);
  } else {
    const UINT32 block = 2 * f.channels;
    hr = made->SetGUID(MF_MT_MAJOR_TYPE, MFMediaType_Audio);
    if (SUCCEEDED(hr)) hr = made->SetGUID(MF_MT_SUBTYPE, MFAudioFormat_PCM);
    if (SUCCEEDED(hr)) hr = made->SetUINT32(MF_MT_AUDIO_NUM_CHANNELS, f.channels);
    if (SUCCEEDED(hr)) hr = made->SetUINT32(MF_MT_AUDIO_SAMPLES_PER_SECOND, f.sampleRate);
    if (SUCCEEDED(hr)) hr = made->SetUINT32(MF_MT_AUDIO_BITS_PER_SAMPLE, 16);
    if (SUCCEEDED(hr)) hr = made->SetUINT32(MF_MT_AUDIO_BLOCK_ALIGNMENT, block);
    if (SUCCEEDED(hr)) hr = made->SetUINT32(MF_MT_AUDIO_AVG_BYTES_PER_SECOND, block * f.sampleRate);
    if (SUCCEEDED(hr)) hr = made->SetUINT32(MF_MT_ALL_SAMPLES_INDEPENDENT, TRUE);
  }
  if (FAILED(hr)) return hr;
  *type = made.Detach();
  return S_OK;
}

// A device object's link is "v4l2:<path>", "lavfi:<graph>" or "lavfi:h264:<graph>" for a camera,
// a PulseAudio source name for a microphone.
std::unique_ptr<Device> deviceFrom(IUnknown* object, bool video) {
  ComPtr<IMFAttributes> attributes;
  if (!object || FAILED(object->QueryInterface(IID_IMFAttributes, reinterpret_cast<void**>(attributes.GetAddressOf()))))
    return nullptr;
  wchar_t* link = nullptr;
  UINT32 length = 0;
  const GUID& key = video ? MF_DEVSOURCE_ATTRIBUTE_SOURCE_TYPE_VIDCAP_SYMBOLIC_LINK
                          : MF_DEVSOURCE_ATTRIBUTE_SOURCE_TYPE_AUDCAP_ENDPOINT_ID;
  if (FAILED(attributes->GetAllocatedString(key, &link, &length))) return nullptr;
  const std::string text = narrow(link);
  CoTaskMemFree(link);
  auto device = std::make_unique<Device>();
  device->video = video;
  if (video) {
    const size_t colon = text.find(':');
    if (colon == std::string::npos) return nullptr;
    device->formatName = text.substr(0, colon);
    device->url = text.substr(colon + 1);
    // "lavfi:h264:<graph>": a test camera that encodes its pictures to H.264 itself.
    static const char h264[] = "h264:";
    if (device->formatName == "lavfi" && device->url.compare(0, sizeof h264 - 1, h264) == 0) {
      device->url.erase(0, sizeof h264 - 1);
      device->encodesH264 = true;
    }
  } else {
    device->formatName = "pulse";
    device->url = text;
    UINT32 value = 0;
    if (SUCCEEDED(attributes->GetUINT32(deviceAudioRate, &value)) && value) device->rate = static_cast<int>(value);
    if (SUCCEEDED(attributes->GetUINT32(deviceAudioChannels, &value)) && value)
      device->channels = static_cast<int>(value);
  }
  return device;
}

}  // namespace platform::capturedevice
