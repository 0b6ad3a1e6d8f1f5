// Interface pointers of the display code: releasing by hand, or when a scope is left.
#pragma once

#include <memory>

namespace capture::video::screen::dxgi {

template <class T>
void release(T*& object) {
  if (object) {
    object->Release();
    object = nullptr;
  }
}

template <class T>
struct Releaser {
  void operator()(T* object) const { object->Release(); }
};

// Released when the scope is left, also through an exception.
template <class T>
using Held = std::unique_ptr<T, Releaser<T>>;

}  // namespace capture::video::screen::dxgi
