// The Media Foundation sink writer on Linux, over FFmpeg. The container comes from
// MF_TRANSCODE_CONTAINERTYPE (else from the file's extension); H.264 output is encoded by a
// hardware encoder when hardware transforms are allowed and one opens, else by libx264 (H.264
// input is copied as it is); AAC by FFmpeg's own encoder. Encoding happens inside WriteSample on
// the caller's thread, so there is nothing to throttle and no queue to wait for; Finalize drains
// the encoders, writes the trailer and closes the file. MP4 is written fragmented as it records
// (the header first, then a fragment of at most 0.9 s at a time, each handed to the system when
// it is complete), so a killed process or a full disk leaves a file that plays up to its last
// fragment, and a finished one starts playing before it has been read to the end.
#include <cstring>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include "platform/linux/ffmpeg/streamencoder.h"
#include "platform/linux/mf/mfstartup.h"

namespace platform::sinkwriter {

namespace {

// FFmpeg's libraries log to standard error at the information level by default; a library
// inside a host process keeps quiet unless the host has chosen a level of its own.
void quietenLogging() {
  static std::once_flag once;
  std::call_once(once, [] {
    if (av_log_get_level() == AV_LOG_INFO) av_log_set_level(AV_LOG_ERROR);
  });
}

struct StreamSlot {
  ComPtr<IMFMediaType> output;
  ComPtr<IMFMediaType> input;
  AVStream* stream = nullptr;
  std::unique_ptr<StreamEncoder> encoder;
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
    if (outMajor == MFMediaType_Video && getGuid(input, MF_MT_SUBTYPE) == MFVideoFormat_H264)
      hr = openVideoCopy(format_, slot.stream, file_.get(), slot.output.Get(), input, &encoder);
    else if (outMajor == MFMediaType_Video)
      hr = openVideoEncoder(format_, slot.stream, file_.get(), slot.output.Get(), input, hardware_, &encoder);
    else
      hr = openAudioEncoder(format_, slot.stream, file_.get(), slot.output.Get(), input, &encoder);
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
      // The header goes out now, so that a host killed before the first fragment leaves an MP4
      // file without media rather than a file of no bytes. Only H.264 passed through without its parameter sets
      // makes it wait for the first fragment (delay_moov), whose first key frame brings them.
      bool parameterSetsLater = false;
      for (const StreamSlot& slot : streams_)
        parameterSetsLater = parameterSetsLater || (slot.stream->codecpar->codec_type == AVMEDIA_TYPE_VIDEO &&
                                                    slot.stream->codecpar->extradata_size == 0);
      av_dict_set(&options, "movflags",
                  parameterSetsLater ? "empty_moov+delay_moov+default_base_moof" : "empty_moov+default_base_moof", 0);
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
    return hr;
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

}  // namespace platform::sinkwriter

HRESULT MFCreateSinkWriterFromURL(LPCWSTR url, IMFByteStream* byteStream, IMFAttributes* attributes,
                                  IMFSinkWriter** sinkWriter) {
  if (!sinkWriter) return E_POINTER;
  *sinkWriter = nullptr;
  if (!url || byteStream) return E_INVALIDARG;  // writing into a byte stream is not offered here
  if (!platform::mediaFoundationStarted()) return MF_E_PLATFORM_NOT_INITIALIZED;
  platform::sinkwriter::quietenLogging();

  const std::string path = platform::narrow(url);
  const GUID container = platform::sinkwriter::getGuid(attributes, MF_TRANSCODE_CONTAINERTYPE);
  const char* muxer = platform::sinkwriter::muxerOf(container);
  const AVOutputFormat* output = muxer ? av_guess_format(muxer, nullptr, nullptr) : nullptr;
  if (!output && container == GUID_NULL) output = av_guess_format(nullptr, path.c_str(), nullptr);
  if (!output) return MF_E_UNSUPPORTED_BYTESTREAM_TYPE;

  // The file is created now, as on Windows, so a bad path fails here with the system's code.
  if (path.empty()) return HRESULT_FROM_WIN32(ERROR_PATH_NOT_FOUND);
  auto file = std::make_unique<platform::Mp4File>(path);
  if (!file->io()) return platform::sinkwriter::fromErrno(file->error());
  AVFormatContext* format = nullptr;
  if (avformat_alloc_output_context2(&format, output, nullptr, path.c_str()) < 0 || !format) return E_OUTOFMEMORY;
  format->pb = file->io();
  format->flags |= AVFMT_FLAG_CUSTOM_IO;
  const bool hardware = platform::sinkwriter::get32(attributes, MF_READWRITE_ENABLE_HARDWARE_TRANSFORMS, 0) != 0;
  const bool mp4 = std::strcmp(output->name, "mp4") == 0;
  *sinkWriter = new platform::sinkwriter::SinkWriter(format, std::move(file), hardware, mp4);
  return S_OK;
}
