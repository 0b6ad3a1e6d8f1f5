#include "platform/linux/ffmpeg/streamencoder.h"

namespace platform::sinkwriter {

namespace {

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

  HRESULT write(const uint8_t* data, DWORD length, LONGLONG time, bool hasTime, LONGLONG duration, bool hasDuration,
                bool cleanPoint) override {
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

}  // namespace

HRESULT openVideoCopy(AVFormatContext* format, AVStream* stream, Mp4File* file, IMFMediaType* output,
                      IMFMediaType* input, std::unique_ptr<StreamEncoder>* encoder) {
  return openStream<VideoCopy>(format, stream, file, encoder, output, input);
}

}  // namespace platform::sinkwriter
