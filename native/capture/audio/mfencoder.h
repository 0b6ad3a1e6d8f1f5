// Writes the packets of one audio endpoint to an AAC MP4 file through a Media Foundation sink
// writer of its own.
#pragma once

#include <cstdint>
#include <string>

#include "capture/audio/encoder.h"
#include "platform/mf.h"
#include "platform/wave.h"

namespace capture::audio {

class MFEncoder : public virtual Encoder {
 public:
  // Starts Media Foundation, creates the file at path (UTF-8) and begins writing. format is the
  // source's capture format and must outlive the encoder. Throws on any failure.
  MFEncoder(const std::string& path, const WAVEFORMATEXTENSIBLE* format);
  // Releases the writer without finalising the file, then shuts Media Foundation down.
  ~MFEncoder() override;
  MFEncoder(const MFEncoder&) = delete;
  MFEncoder& operator=(const MFEncoder&) = delete;

  using Encoder::write;
  void write(const uint8_t* data, uint32_t frames, const WAVEFORMATEX* format, int64_t time) override;
  void finalize() override;

 private:
  const WAVEFORMATEXTENSIBLE* format;
  uint32_t streamIndex = 0;
  ComPtr<IMFSinkWriter> sinkWriter;
};

}  // namespace capture::audio
