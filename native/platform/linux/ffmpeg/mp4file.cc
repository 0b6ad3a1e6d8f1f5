#include "platform/linux/ffmpeg/mp4file.h"

#include <fcntl.h>
#include <sys/file.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cmath>
#include <cstring>

extern "C" {
#include <libavutil/error.h>
#include <libavutil/mem.h>
}

namespace platform {

namespace {

constexpr int bufferSize = 1 << 16;

uint32_t read32(const uint8_t* p) {
  return static_cast<uint32_t>(p[0]) << 24 | static_cast<uint32_t>(p[1]) << 16 | static_cast<uint32_t>(p[2]) << 8 |
         p[3];
}

void write32(uint8_t* p, uint32_t v) {
  p[0] = static_cast<uint8_t>(v >> 24);
  p[1] = static_cast<uint8_t>(v >> 16);
  p[2] = static_cast<uint8_t>(v >> 8);
  p[3] = static_cast<uint8_t>(v);
}

void write64(uint8_t* p, uint64_t v) {
  write32(p, static_cast<uint32_t>(v >> 32));
  write32(p + 4, static_cast<uint32_t>(v));
}

// Calls `visit(type, offset, size)` for each box in [begin, end) of `data`; stops at a box that
// does not fit.
template <class Visit>
void forEachBox(const std::vector<uint8_t>& data, size_t begin, size_t end, Visit visit) {
  while (begin + 8 <= end) {
    const uint32_t size = read32(&data[begin]);
    if (size < 8 || begin + size > end) return;
    visit(std::string(reinterpret_cast<const char*>(&data[begin + 4]), 4), begin, static_cast<size_t>(size));
    begin += size;
  }
}

// Puts an empty movie extends header (mehd) first into the mvex box of the movie box `head`. The
// muxer writes none into a fragmented file, and without it Firefox shows such a file as long as
// the part it has read. The room comes from the udta box after mvex (the muxer's name), which
// becomes a free box: the movie box keeps its size, since the fragments after it cannot move.
// Without room it does nothing.
void addMehd(std::vector<uint8_t>& head) {
  constexpr size_t mehdSize = 20;  // version 1: a 64-bit duration
  size_t mvex = 0, mvexSize = 0, udta = 0, udtaSize = 0;
  forEachBox(head, 8, head.size(), [&](const std::string& type, size_t offset, size_t size) {
    if (type == "mvex") mvex = offset, mvexSize = size;
    if (type == "udta" && mvexSize) udta = offset, udtaSize = size;
  });
  if (!mvexSize) return;
  bool present = false;
  forEachBox(head, mvex + 8, mvex + mvexSize,
             [&](const std::string& type, size_t, size_t) { present = present || type == "mehd"; });
  if (present) return;
  if (udtaSize < mehdSize + 8) return;
  std::vector<uint8_t> room(mehdSize, 0);
  write32(&room[0], mehdSize);
  std::memcpy(&room[4], "mehd", 4);
  room[8] = 1;
  head.erase(head.begin() + static_cast<std::ptrdiff_t>(udta + udtaSize - mehdSize),
             head.begin() + static_cast<std::ptrdiff_t>(udta + udtaSize));
  write32(&head[udta], static_cast<uint32_t>(udtaSize - mehdSize));
  std::memcpy(&head[udta + 4], "free", 4);
  std::fill(head.begin() + static_cast<std::ptrdiff_t>(udta + 8),
            head.begin() + static_cast<std::ptrdiff_t>(udta + udtaSize - mehdSize), 0);
  head.insert(head.begin() + static_cast<std::ptrdiff_t>(mvex + 8), room.begin(), room.end());
  write32(&head[mvex], static_cast<uint32_t>(mvexSize + mehdSize));
}

}  // namespace

Mp4File::Mp4File(const std::string& path) {
  // Read and write: the header is read back when its durations are stamped. The file is emptied
  // only once it is ours: one that another writer holds (a clip still being finished under the
  // same name) is refused, as Windows refuses to share a file it writes, rather than both writing
  // over each other.
  fd_ = ::open(path.c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0644);
  if (fd_ < 0) {
    error_ = errno;
    return;
  }
  // A file system without locks records all the same, and so does a device (EINVAL: it has no
  // length to cut).
  const bool held = ::flock(fd_, LOCK_EX | LOCK_NB) != 0 && errno == EWOULDBLOCK;
  if (held || (::ftruncate(fd_, 0) != 0 && errno != EINVAL)) {
    error_ = held ? EBUSY : errno;
    ::close(fd_);
    fd_ = -1;
    return;
  }
  auto* buffer = static_cast<unsigned char*>(av_malloc(bufferSize));
  io_ = buffer ? avio_alloc_context(buffer, bufferSize, 1, this, nullptr, writePacket, seek) : nullptr;
  if (!io_) {
    av_free(buffer);
    error_ = ENOMEM;
  }
}

Mp4File::~Mp4File() {
  if (io_) {
    // What is still buffered belongs to a piece the muxer never finished: it is not written.
    av_freep(&io_->buffer);
    avio_context_free(&io_);
  }
  if (fd_ >= 0) ::close(fd_);
}

int Mp4File::writePacket(void* opaque, uint8_t* data, int size) {
  auto* self = static_cast<Mp4File*>(opaque);
  int done = 0;
  while (done < size) {
    const ssize_t n = ::pwrite(self->fd_, data + done, static_cast<size_t>(size - done), self->position_);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) return AVERROR(n < 0 ? errno : ENOSPC);
    done += static_cast<int>(n);
    self->position_ += n;
    if (self->position_ > self->end_) self->end_ = self->position_;
  }
  return size;
}

int64_t Mp4File::seek(void* opaque, int64_t offset, int whence) {
  auto* self = static_cast<Mp4File*>(opaque);
  switch (whence & ~AVSEEK_FORCE) {
    case AVSEEK_SIZE: return self->end_;
    case SEEK_SET: break;
    case SEEK_CUR: offset += self->position_; break;
    case SEEK_END: offset += self->end_; break;
    default: return AVERROR(EINVAL);
  }
  if (offset < 0) return AVERROR(EINVAL);
  self->position_ = offset;
  return offset;
}

void Mp4File::commit() {
  if (io_ && !io_->error) committed_ = end_;
}

void Mp4File::rollback() {
  if (fd_ < 0) return;
  if (::ftruncate(fd_, committed_) == 0) end_ = position_ = committed_;
  if (io_) io_->buf_ptr = io_->buf_ptr_max = io_->buffer;  // drop the unwritten rest of the failed piece
}

void Mp4File::setTrackEnd(size_t track, double seconds) {
  if (trackEnds_.size() <= track) trackEnds_.resize(track + 1, 0.0);
  trackEnds_[track] = seconds;
}

void Mp4File::stampDurations() {
  if (fd_ < 0 || end_ < 16) return;
  double movieSeconds = 0;
  for (double seconds : trackEnds_) movieSeconds = std::max(movieSeconds, seconds);
  // The header is small and at the start (ftyp, then moov): only moov is read back, found by the
  // boxes' sizes, since this runs at every fragment of a file that keeps growing.
  int64_t moov = 0;
  size_t moovSize = 0;
  for (int64_t at = 0; at + 8 <= end_ && !moovSize;) {
    uint8_t box[16];
    if (::pread(fd_, box, 8, at) != 8) return;
    uint64_t size = read32(box);
    if (size == 1) {  // a 64-bit size follows the type (a large mdat)
      if (::pread(fd_, box + 8, 8, at + 8) != 8) return;
      size = static_cast<uint64_t>(read32(box + 8)) << 32 | read32(box + 12);
    }
    if (size < 8 || size > static_cast<uint64_t>(end_ - at)) return;
    if (std::memcmp(box + 4, "moov", 4) == 0)
      moov = at, moovSize = static_cast<size_t>(size);
    else
      at += static_cast<int64_t>(size);
  }
  if (!moovSize) return;
  std::vector<uint8_t> head(moovSize);
  if (::pread(fd_, head.data(), moovSize, moov) != static_cast<ssize_t>(moovSize)) return;

  uint32_t timescale = 0;
  auto stamp = [&](size_t field, bool wide, double seconds) {
    const uint64_t units = static_cast<uint64_t>(std::llround(std::max(0.0, seconds) * timescale));
    if (wide)
      write64(&head[field], units);
    else
      write32(&head[field], static_cast<uint32_t>(std::min<uint64_t>(units, UINT32_MAX)));
  };
  addMehd(head);
  size_t track = 0;
  forEachBox(head, 8, moovSize, [&](const std::string& type, size_t offset, size_t size) {
    if (type == "mvhd" && size >= 32) {
      const bool wide = head[offset + 8] == 1;
      if (wide && size < 44) return;
      timescale = read32(&head[offset + (wide ? 28 : 20)]);
      stamp(offset + (wide ? 32 : 24), wide, movieSeconds);
    } else if (type == "trak" && timescale) {
      const double seconds = track < trackEnds_.size() ? trackEnds_[track] : movieSeconds;
      ++track;
      forEachBox(head, offset + 8, offset + size, [&](const std::string& inner, size_t at, size_t length) {
        if (inner != "tkhd" || length < 32) return;
        const bool wide = head[at + 8] == 1;
        if (wide && length < 44) return;
        stamp(at + (wide ? 36 : 28), wide, seconds);
      });
    } else if (type == "mvex" && timescale) {
      forEachBox(head, offset + 8, offset + size, [&](const std::string& inner, size_t at, size_t length) {
        if (inner == "mehd" && length >= 16) stamp(at + 12, head[at + 8] == 1 && length >= 20, movieSeconds);
      });
    }
  });
  if (timescale) (void)!::pwrite(fd_, head.data(), moovSize, static_cast<off_t>(moov));
}

int Mp4File::close() {
  int result = 0;
  if (io_) {
    avio_flush(io_);
    result = io_->error;
    if (result < 0) rollback();  // what did not fit stays out: the file ends with a whole piece
  }
  if (fd_ >= 0 && ::close(fd_) != 0 && result >= 0) result = AVERROR(errno);
  fd_ = -1;
  return result < 0 ? result : 0;
}

}  // namespace platform
