#include "capture/audio/mfencoder.h"

#include <cstring>
#include <iostream>
#include <stdexcept>

#include "capture/check.h"
#include "capture/held.h"
#include "capture/log.h"
#include "capture/text.h"

namespace capture::audio {

namespace {

const char* const file = "native/capture/audio/mfencoder";

}  // namespace

// A failure leaves Media Foundation started, as the caller expects; the objects made so far
// are released on the way out, which nothing can observe but the memory.
MFEncoder::MFEncoder(std::string path, const WAVEFORMATEXTENSIBLE* format) : format(format) {
  try {
    checkResult(file, 22, MFStartup(MF_VERSION, MFSTARTUP_FULL), "Unable to start media foundation.");

    Held<IMFAttributes> attributes;
    checkResult(file, 26, MFCreateAttributes(&attributes.object, 0), "Unable to create attributes for writer.");
    checkResult(file, 27, attributes.object->SetUINT32(MF_LOW_LATENCY, 1), "Unable to set MF_LOW_LATENCY attribute.");
    checkResult(file, 28, attributes.object->SetUINT32(MF_READWRITE_ENABLE_HARDWARE_TRANSFORMS, 1),
                "Unable to set MF_READWRITE_ENABLE_HARDWARE_TRANSFORMS attribute.");
    checkResult(file, 29, attributes.object->SetUINT32(MF_SINK_WRITER_DISABLE_THROTTLING, 1),
                "Unable to set MF_SINK_WRITER_DISABLE_THROTTLING attribute.");
    checkResult(file, 30, attributes.object->SetGUID(MF_TRANSCODE_CONTAINERTYPE, MFTranscodeContainerType_MPEG4),
                "Unable to set MF_TRANSCODE_CONTAINERTYPE attribute.");

    const std::wstring widePath = toWide(path);
    std::cout << "File: " << path << std::endl;
    checkResult(file, 35, MFCreateSinkWriterFromURL(widePath.c_str(), nullptr, attributes.object, &sinkWriter),
                "Could not create sink.");
    attributes.release();

    Held<IMFMediaType> output;
    checkResult(file, 41, MFCreateMediaType(&output.object), "Could not create output media type.");
    checkResult(file, 42, output.object->SetGUID(MF_MT_MAJOR_TYPE, MFMediaType_Audio),
                "Unable to set major type of output.");
    checkResult(file, 43, output.object->SetGUID(MF_MT_SUBTYPE, MFAudioFormat_AAC), "Unable to set subtype of output.");
    checkResult(file, 44, output.object->SetUINT32(MF_MT_AUDIO_BITS_PER_SAMPLE, 16),
                "Unable to set bits per sample of output.");
    checkResult(file, 45, output.object->SetUINT32(MF_MT_AUDIO_SAMPLES_PER_SECOND, format->Format.nSamplesPerSec),
                "Unable to set samples per second of output.");
    checkResult(file, 46, output.object->SetUINT32(MF_MT_AUDIO_NUM_CHANNELS, format->Format.nChannels),
                "Unable to set audio channel count of output.");
    checkResult(file, 47, output.object->SetUINT32(MF_MT_AUDIO_AVG_BYTES_PER_SECOND, 24000),
                "Unable to set bitrate of output.");
    DWORD index = 0;
    checkResult(file, 48, sinkWriter->AddStream(output.object, &index), "Could not add stream to writer.");
    streamIndex = index;
    output.release();

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

    Held<IMFMediaType> input;
    checkResult(file, 60, MFCreateMediaType(&input.object), "Could not create media type.");
    checkResult(file, 61, MFInitMediaTypeFromWaveFormatEx(input.object, &plain, sizeof plain),
                "Could not initialize media type from wave format.");
    checkResult(file, 64, input.object->SetUINT32(MF_MT_AUDIO_CHANNEL_MASK, format->dwChannelMask),
                "Unable to set surround sound bit mask for input media type.");
    checkResult(file, 65, sinkWriter->SetInputMediaType(streamIndex, input.object, nullptr),
                "Could not set input media type.");
    input.release();

    checkResult(file, 70, sinkWriter->BeginWriting(), "Unable to start the sink writer.");
  } catch (...) {
    if (sinkWriter) sinkWriter->Release();
    sinkWriter = nullptr;
    throw;
  }
}

// A destructor cannot pass the shut-down failure on (the interface's destructor does not
// throw), so its text becomes a warning line.
MFEncoder::~MFEncoder() {
  if (sinkWriter) sinkWriter->Release();
  sinkWriter = nullptr;
  try {
    checkResult(file, 75, MFShutdown(), "Could not properly shut down audio encoder.");
  } catch (const std::runtime_error& error) {
    logWarning(error.what());
  }
}

void MFEncoder::write(const uint8_t* data, uint32_t frames, const WAVEFORMATEX* format, int64_t time) {
  const uint32_t size = static_cast<uint32_t>(format->nBlockAlign) * frames;
  Held<IMFMediaBuffer> buffer;
  checkResult(file, 86, MFCreateMemoryBuffer(size, &buffer.object), "Unable to create memory buffer.");
  BYTE* destination = nullptr;
  checkResult(file, 89, buffer.object->Lock(&destination, nullptr, nullptr), "Could not get a lock on input buffer.");
  if (size) std::memcpy(destination, data, size);
  checkResult(file, 93, buffer.object->Unlock(), "Could not unlock input buffer.");
  checkResult(file, 95, buffer.object->SetCurrentLength(size), "Could not set the buffer's current length.");

  Held<IMFSample> sample;
  checkResult(file, 98, MFCreateSample(&sample.object), "Could not create sample.");
  checkResult(file, 99, sample.object->AddBuffer(buffer.object), "Could not add input buffer to sample.");
  // The first packet of a recording (time 0) carries no time.
  if (time != 0) checkResult(file, 102, sample.object->SetSampleTime(time), "Could not set sample time.");
  // Kept in this form on purpose: for every real packet the quotient truncates to 0.
  const auto duration = static_cast<LONGLONG>(frames / (format->nSamplesPerSec * 10000000.0));
  checkResult(file, 105, sample.object->SetSampleDuration(duration), "Could not set sample duration.");
  checkResult(file, 106, sinkWriter->WriteSample(0, sample.object), "Could not write sample.");
}

void MFEncoder::finalize() {
  checkResult(file, 113, sinkWriter->Finalize(), "Unable to finalize audio encoder.");
}

}  // namespace capture::audio
