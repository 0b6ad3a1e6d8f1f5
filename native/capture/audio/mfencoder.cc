#include "capture/audio/mfencoder.h"

#include <cstring>
#include <iostream>
#include <stdexcept>

#include "capture/check.h"
#include "capture/log.h"
#include "capture/text.h"

namespace capture::audio {

namespace {

const char* const file = "native/capture/audio/mfencoder";

}  // namespace

// A failure leaves Media Foundation started, as the caller expects; the objects made so far
// are released on the way out, which nothing can observe but the memory.
MFEncoder::MFEncoder(const std::string& path, const WAVEFORMATEXTENSIBLE* format) : format(format) {
  try {
    checkResult(file, 22, MFStartup(MF_VERSION, MFSTARTUP_FULL), "Unable to start media foundation.");

    ComPtr<IMFAttributes> attributes;
    checkResult(file, 26, MFCreateAttributes(attributes.GetAddressOf(), 0), "Unable to create attributes for writer.");
    checkResult(file, 27, attributes->SetUINT32(MF_LOW_LATENCY, 1), "Unable to set MF_LOW_LATENCY attribute.");
    checkResult(file, 28, attributes->SetUINT32(MF_READWRITE_ENABLE_HARDWARE_TRANSFORMS, 1),
                "Unable to set MF_READWRITE_ENABLE_HARDWARE_TRANSFORMS attribute.");
    checkResult(file, 29, attributes->SetUINT32(MF_SINK_WRITER_DISABLE_THROTTLING, 1),
                "Unable to set MF_SINK_WRITER_DISABLE_THROTTLING attribute.");
    checkResult(file, 30, attributes->SetGUID(MF_TRANSCODE_CONTAINERTYPE, MFTranscodeContainerType_MPEG4),
                "Unable to set MF_TRANSCODE_CONTAINERTYPE attribute.");

    const std::wstring widePath = toWide(path);
    std::cout << "File: " << path << std::endl;
    checkResult(file, 35,
                MFCreateSinkWriterFromURL(widePath.c_str(), nullptr, attributes.Get(), sinkWriter.GetAddressOf()),
                "Could not create sink.");
    attributes.Reset();

    ComPtr<IMFMediaType> output;
    checkResult(file, 41, MFCreateMediaType(output.GetAddressOf()), "Could not create output media type.");
    checkResult(file, 42, output->SetGUID(MF_MT_MAJOR_TYPE, MFMediaType_Audio), "Unable to set major type of output.");
    checkResult(file, 43, output->SetGUID(MF_MT_SUBTYPE, MFAudioFormat_AAC), "Unable to set subtype of output.");
    checkResult(file, 44, output->SetUINT32(MF_MT_AUDIO_BITS_PER_SAMPLE, 16),
                "Unable to set bits per sample of output.");
    checkResult(file, 45, output->SetUINT32(MF_MT_AUDIO_SAMPLES_PER_SECOND, format->Format.nSamplesPerSec),
                "Unable to set samples per second of output.");
    checkResult(file, 46, output->SetUINT32(MF_MT_AUDIO_NUM_CHANNELS, format->Format.nChannels),
                "Unable to set audio channel count of output.");
    checkResult(file, 47, output->SetUINT32(MF_MT_AUDIO_AVG_BYTES_PER_SECOND, 24000),
                "Unable to set bitrate of output.");
    DWORD index = 0;
    checkResult(file, 48, sinkWriter->AddStream(output.Get(), &index), "Could not add stream to writer.");
    streamIndex = index;
    output.Reset();

    // The plain 18-byte wave format of the input, its tag taken from the extensible subtype.
    WAVEFORMATEX plain;
    std::memcpy(&plain, format, sizeof plain);
    const GUID subFormat = format->SubFormat;
    if (subFormat == KSDATAFORMAT_SUBTYPE_PCM)
      plain.wFormatTag = WAVE_FORMAT_PCM;
    else if (subFormat == KSDATAFORMAT_SUBTYPE_IEEE_FLOAT)
      plain.wFormatTag = WAVE_FORMAT_IEEE_FLOAT;
    else
      throw std::runtime_error(std::string(file) + "(144): " + "Unable to set format tag.");
    plain.cbSize = 0;

    ComPtr<IMFMediaType> input;
    checkResult(file, 60, MFCreateMediaType(input.GetAddressOf()), "Could not create media type.");
    checkResult(file, 61, MFInitMediaTypeFromWaveFormatEx(input.Get(), &plain, sizeof plain),
                "Could not initialize media type from wave format.");
    checkResult(file, 64, input->SetUINT32(MF_MT_AUDIO_CHANNEL_MASK, format->dwChannelMask),
                "Unable to set surround sound bit mask for input media type.");
    checkResult(file, 65, sinkWriter->SetInputMediaType(streamIndex, input.Get(), nullptr),
                "Could not set input media type.");
    input.Reset();

    checkResult(file, 70, sinkWriter->BeginWriting(), "Unable to start the sink writer.");
  } catch (...) {
    sinkWriter.Reset();
    throw;
  }
}

// A destructor cannot pass the shut-down failure on (the interface's destructor does not
// throw), so its text becomes a warning line.
MFEncoder::~MFEncoder() {
  sinkWriter.Reset();  // before Media Foundation shuts down
  try {
    checkResult(file, 75, MFShutdown(), "Could not properly shut down audio encoder.");
  } catch (const std::runtime_error& error) {
    logWarning(error.what());
  }
}

void MFEncoder::write(const uint8_t* data, uint32_t frames, const WAVEFORMATEX* format, int64_t time) {
  const uint32_t size = static_cast<uint32_t>(format->nBlockAlign) * frames;
  ComPtr<IMFMediaBuffer> buffer;
  checkResult(file, 86, MFCreateMemoryBuffer(size, buffer.GetAddressOf()), "Unable to create memory buffer.");
  BYTE* destination = nullptr;
  checkResult(file, 89, buffer->Lock(&destination, nullptr, nullptr), "Could not get a lock on input buffer.");
  if (size) std::memcpy(destination, data, size);
  checkResult(file, 93, buffer->Unlock(), "Could not unlock input buffer.");
  checkResult(file, 95, buffer->SetCurrentLength(size), "Could not set the buffer's current length.");

  ComPtr<IMFSample> sample;
  checkResult(file, 98, MFCreateSample(sample.GetAddressOf()), "Could not create sample.");
  checkResult(file, 99, sample->AddBuffer(buffer.Get()), "Could not add input buffer to sample.");
  // The first packet of a recording (time 0) carries no time.
  if (time != 0) checkResult(file, 102, sample->SetSampleTime(time), "Could not set sample time.");
  // Kept in this form on purpose: for every real packet the quotient truncates to 0.
  const auto duration = static_cast<LONGLONG>(frames / (format->nSamplesPerSec * 10000000.0));
  checkResult(file, 105, sample->SetSampleDuration(duration), "Could not set sample duration.");
  checkResult(file, 106, sinkWriter->WriteSample(0, sample.Get()), "Could not write sample.");
}

void MFEncoder::finalize() { checkResult(file, 113, sinkWriter->Finalize(), "Unable to finalize audio encoder."); }

}  // namespace capture::audio
