// A holder of one COM reference, with the members and meaning of WRL's Microsoft::WRL::ComPtr,
// which the Windows build uses under the same name: copies AddRef, moves take over, the
// destructor and every reassignment Release. The creating calls of the API hand out a reference
// that is already counted: they write through GetAddressOf() (or &, which lets the old one go
// first), and Attach() takes one without counting.
#pragma once

#include <cstddef>
#include <type_traits>
#include <utility>

#include "platform/linux/com.h"

template <class T>
class ComPtr {
 public:
  using InterfaceType = T;

  ComPtr() noexcept = default;
  ComPtr(std::nullptr_t) noexcept {}  // NOLINT(google-explicit-constructor): as WRL's
  template <class U, class = std::enable_if_t<std::is_convertible_v<U*, T*>>>
  ComPtr(U* other) noexcept : pointer_(other) {  // NOLINT(google-explicit-constructor)
    addRef();
  }
  ComPtr(const ComPtr& other) noexcept : pointer_(other.pointer_) { addRef(); }
  template <class U, class = std::enable_if_t<std::is_convertible_v<U*, T*>>>
  ComPtr(const ComPtr<U>& other) noexcept : pointer_(other.Get()) {  // NOLINT(google-explicit-constructor)
    addRef();
  }
  ComPtr(ComPtr&& other) noexcept : pointer_(std::exchange(other.pointer_, nullptr)) {}
  template <class U, class = std::enable_if_t<std::is_convertible_v<U*, T*>>>
  ComPtr(ComPtr<U>&& other) noexcept : pointer_(other.Detach()) {}  // NOLINT(google-explicit-constructor)
  ~ComPtr() { release(); }

  ComPtr& operator=(std::nullptr_t) noexcept {
    release();
    return *this;
  }
  ComPtr& operator=(T* other) noexcept {
    ComPtr(other).Swap(*this);
    return *this;
  }
  ComPtr& operator=(const ComPtr& other) noexcept {
    if (this != &other) ComPtr(other).Swap(*this);
    return *this;
  }
  ComPtr& operator=(ComPtr&& other) noexcept {
    ComPtr(std::move(other)).Swap(*this);
    return *this;
  }

  T* Get() const noexcept { return pointer_; }
  T* operator->() const noexcept { return pointer_; }
  explicit operator bool() const noexcept { return pointer_ != nullptr; }

  // The slot itself, for a call that fills an empty holder.
  T* const* GetAddressOf() const noexcept { return &pointer_; }
  T** GetAddressOf() noexcept { return &pointer_; }
  // Lets the held reference go first, for a call that fills the holder anew.
  T** ReleaseAndGetAddressOf() noexcept {
    release();
    return &pointer_;
  }
  T** operator&() noexcept { return ReleaseAndGetAddressOf(); }

  // Takes a reference that is already counted, and gives one up without releasing it.
  void Attach(T* other) noexcept {
    release();
    pointer_ = other;
  }
  T* Detach() noexcept { return std::exchange(pointer_, nullptr); }
  void Reset() noexcept { release(); }
  void Swap(ComPtr& other) noexcept { std::swap(pointer_, other.pointer_); }

  // A counted copy for an out parameter.
  HRESULT CopyTo(T** out) const noexcept {
    addRef();
    *out = pointer_;
    return S_OK;
  }

 private:
  void addRef() const noexcept {
    if (pointer_) pointer_->AddRef();
  }
  void release() noexcept {
    if (T* old = std::exchange(pointer_, nullptr)) old->Release();
  }

  T* pointer_ = nullptr;
};

namespace platform {

// Makes a T and answers its interface riid: the object lives on only through that answer.
template <class T, class... Args>
HRESULT createInstance(REFIID riid, void** object, Args&&... args) {
  ComPtr<T> made;
  made.Attach(new T(std::forward<Args>(args)...));
  return made->QueryInterface(riid, object);
}

}  // namespace platform
