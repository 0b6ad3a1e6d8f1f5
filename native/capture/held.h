// A platform interface pointer released when its scope is left, also through an exception.
#pragma once

namespace capture {

// `&held.object` receives the pointer from a creating call; release() lets it go early.
template <class T>
struct Held {
  T* object = nullptr;

  Held() = default;
  Held(const Held&) = delete;
  Held& operator=(const Held&) = delete;
  ~Held() { release(); }

  void release() {
    if (object) object->Release();
    object = nullptr;
  }
};

}  // namespace capture
