#include "capture/video/copy.h"

#include <algorithm>
#include <cstdint>
#include <cstring>

#if defined(__SSE2__) || defined(_M_X64)
#include <emmintrin.h>
#define TAVIO_STREAMING_STORES 1
#endif

namespace capture::video {

void copyPicture(void* dst, const void* src, size_t bytes) {
  auto* to = static_cast<uint8_t*>(dst);
  auto* from = static_cast<const uint8_t*>(src);
#if defined(TAVIO_STREAMING_STORES)
  // Streaming stores want 16-byte aligned targets; the bytes before the first such address
  // go the ordinary way.
  const size_t head = std::min<size_t>(bytes, (16 - reinterpret_cast<uintptr_t>(to) % 16) % 16);
  std::memcpy(to, from, head);
  to += head;
  from += head;
  bytes -= head;
  for (; bytes >= 64; bytes -= 64, to += 64, from += 64) {
    const __m128i a = _mm_loadu_si128(reinterpret_cast<const __m128i*>(from));
    const __m128i b = _mm_loadu_si128(reinterpret_cast<const __m128i*>(from + 16));
    const __m128i c = _mm_loadu_si128(reinterpret_cast<const __m128i*>(from + 32));
    const __m128i d = _mm_loadu_si128(reinterpret_cast<const __m128i*>(from + 48));
    _mm_stream_si128(reinterpret_cast<__m128i*>(to), a);
    _mm_stream_si128(reinterpret_cast<__m128i*>(to + 16), b);
    _mm_stream_si128(reinterpret_cast<__m128i*>(to + 32), c);
    _mm_stream_si128(reinterpret_cast<__m128i*>(to + 48), d);
  }
  // Streaming stores are weakly ordered: fence them before the frame is handed on.
  _mm_sfence();
#endif
  std::memcpy(to, from, bytes);
}

}  // namespace capture::video
