#pragma once

#include <cstddef>

namespace capture::video {

// memcpy for a picture that another thread reads later: the stores bypass the cache, so
// copying into memory nobody touched lately needn't read it first, and the copy doesn't push
// out what the caller still works on.
void copyPicture(void* dst, const void* src, size_t bytes);

}  // namespace capture::video
