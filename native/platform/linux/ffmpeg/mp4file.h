// The file a sink writer's muxer writes into. Every write goes straight to the operating system,
// so what the muxer has finished is on disk even if the process is killed; a failed write
// rolls the file back to the end of the last whole piece, so a full disk leaves a file that
// plays up to there. For MP4 it also keeps the durations in the movie header up to date, since
// a fragmented file's header is written before anything is known about its length.
#pragma once

#include <cstdint>
#include <string>
#include <vector>

extern "C" {
#include <libavformat/avio.h>
}

namespace platform {

class Mp4File {
 public:
  // Creates (or truncates) the file; on failure errno-style `error()` is set and `io()` is null.
  explicit Mp4File(const std::string& path);
  ~Mp4File();
  Mp4File(const Mp4File&) = delete;
  Mp4File& operator=(const Mp4File&) = delete;

  AVIOContext* io() const { return io_; }
  int error() const { return error_; }

  // Everything written so far is whole (the muxer has returned): it is kept by a later rollback.
  void commit();
  // Cuts the file back to the last commit; used when a write failed half-way.
  void rollback();
  int64_t length() const { return end_; }
  // Track `track` holds `seconds` of media in what the file holds now.
  void setTrackEnd(size_t track, double seconds);
  // Writes the tracks' lengths into their headers (tkhd) and the longest into the movie header
  // (mvhd) and the movie extends header (mehd, made if the header has none), in the header's own time
  // scale. Does nothing while the file has no MP4 header yet.
  void stampDurations();
  // Flushes and closes; returns 0 or a negative AVERROR.
  int close();

 private:
  static int writePacket(void* opaque, uint8_t* data, int size);
  static int64_t seek(void* opaque, int64_t offset, int whence);

  int fd_ = -1;
  int error_ = 0;
  AVIOContext* io_ = nullptr;
  int64_t position_ = 0;  // the muxer's write position
  int64_t end_ = 0;       // the file's length
  int64_t committed_ = 0;
  std::vector<double> trackEnds_;
};

}  // namespace platform
