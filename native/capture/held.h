// Platform interface pointers: released by hand, or when a scope is left (also through an exception).
#pragma once

namespace capture {

template <class T>
void release(T*& object) {
  if (object) {
    object->Release();
    object = nullptr;
  }
}

// `&held.object` receives the pointer from a creating call; release() lets it go early.
template <class T>
struct Held {
  T* object = nullptr;

  Held() = default;
  explicit Held(T* taken) : object(taken) {}
  Held(const Held&) = delete;
  Held& operator=(const Held&) = delete;
  ~Held() { release(); }

  T* operator->() const { return object; }
  explicit operator bool() const { return object != nullptr; }
  void release() { capture::release(object); }
};

}  // namespace capture
