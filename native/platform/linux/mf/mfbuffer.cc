// Memory buffers, samples and collections on Linux.
#include <cstdlib>
#include <cstring>
#include <vector>

#include "platform/linux/mf/mfattributes.h"

namespace platform {

namespace {

// A block of system memory, aligned as Media Foundation aligns its memory buffers (at least
// 16 bytes; 64 here, which also suits the SIMD paths of the converters that read it).
class MemoryBuffer : public ComObject<IMFMediaBuffer, IID_IMFMediaBuffer> {
 public:
  explicit MemoryBuffer(DWORD maxLength)
      : data_(static_cast<BYTE*>(std::aligned_alloc(64, (static_cast<size_t>(maxLength) + 63) / 64 * 64 + 64))),
        maxLength_(maxLength) {}
  ~MemoryBuffer() override { std::free(data_); }

  bool valid() const { return data_ != nullptr; }

  HRESULT Lock(BYTE** buffer, DWORD* maxLength, DWORD* currentLength) override {
    if (!buffer) return E_POINTER;
    *buffer = data_;
    if (maxLength) *maxLength = maxLength_;
    if (currentLength) *currentLength = currentLength_;
    return S_OK;
  }
  HRESULT Unlock() override { return S_OK; }
  HRESULT GetCurrentLength(DWORD* length) override {
    if (!length) return E_POINTER;
    *length = currentLength_;
    return S_OK;
  }
  HRESULT SetCurrentLength(DWORD length) override {
    if (length > maxLength_) return E_INVALIDARG;
    currentLength_ = length;
    return S_OK;
  }
  HRESULT GetMaxLength(DWORD* length) override {
    if (!length) return E_POINTER;
    *length = maxLength_;
    return S_OK;
  }

 private:
  BYTE* data_;
  const DWORD maxLength_;
  DWORD currentLength_ = 0;
};

class Sample : public Attributes<IMFSample, IID_IMFSample> {
 public:
  HRESULT GetSampleTime(LONGLONG* time) override {
    if (!time) return E_POINTER;
    if (!hasTime_) return MF_E_NO_SAMPLE_TIMESTAMP;
    *time = time_;
    return S_OK;
  }
  HRESULT SetSampleTime(LONGLONG time) override {
    time_ = time;
    hasTime_ = true;
    return S_OK;
  }
  HRESULT GetSampleDuration(LONGLONG* duration) override {
    if (!duration) return E_POINTER;
    if (!hasDuration_) return MF_E_NO_SAMPLE_DURATION;
    *duration = duration_;
    return S_OK;
  }
  HRESULT SetSampleDuration(LONGLONG duration) override {
    duration_ = duration;
    hasDuration_ = true;
    return S_OK;
  }
  HRESULT GetBufferCount(DWORD* count) override {
    if (!count) return E_POINTER;
    *count = static_cast<DWORD>(buffers_.size());
    return S_OK;
  }
  HRESULT GetBufferByIndex(DWORD index, IMFMediaBuffer** buffer) override {
    if (!buffer) return E_POINTER;
    if (index >= buffers_.size()) return E_INVALIDARG;
    return buffers_[index].CopyTo(buffer);
  }
  // One buffer is handed out as it is; several are joined into a new buffer that then replaces
  // them in the sample, as Media Foundation does.
  HRESULT ConvertToContiguousBuffer(IMFMediaBuffer** buffer) override {
    if (!buffer) return E_POINTER;
    if (buffers_.empty()) return E_UNEXPECTED;
    if (buffers_.size() == 1) return buffers_[0].CopyTo(buffer);
    DWORD total = 0;
    for (const ComPtr<IMFMediaBuffer>& part : buffers_) {
      DWORD current = 0;
      part->GetCurrentLength(&current);
      total += current;
    }
    ComPtr<IMFMediaBuffer> joined;
    HRESULT hr = MFCreateMemoryBuffer(total, joined.GetAddressOf());
    if (FAILED(hr)) return hr;
    BYTE* out = nullptr;
    joined->Lock(&out, nullptr, nullptr);
    DWORD offset = 0;
    for (const ComPtr<IMFMediaBuffer>& part : buffers_) {
      BYTE* in = nullptr;
      DWORD current = 0;
      if (SUCCEEDED(part->Lock(&in, nullptr, &current))) {
        if (current) std::memcpy(out + offset, in, current);
        offset += current;
        part->Unlock();
      }
    }
    joined->Unlock();
    joined->SetCurrentLength(offset);
    buffers_.assign(1, joined);
    return joined.CopyTo(buffer);
  }
  HRESULT AddBuffer(IMFMediaBuffer* buffer) override {
    if (!buffer) return E_INVALIDARG;
    buffers_.emplace_back(buffer);
    return S_OK;
  }

 private:
  std::vector<ComPtr<IMFMediaBuffer>> buffers_;
  LONGLONG time_ = 0;
  LONGLONG duration_ = 0;
  bool hasTime_ = false;
  bool hasDuration_ = false;
};

class Collection : public ComObject<IMFCollection, IID_IMFCollection> {
 public:
  HRESULT GetElement(DWORD index, IUnknown** element) override {
    if (!element) return E_POINTER;
    if (index >= elements_.size()) return E_INVALIDARG;
    *element = nullptr;
    return elements_[index] ? elements_[index].CopyTo(element) : S_OK;
  }
  HRESULT AddElement(IUnknown* element) override {
    elements_.emplace_back(element);
    return S_OK;
  }

 private:
  std::vector<ComPtr<IUnknown>> elements_;
};

}  // namespace

}  // namespace platform

HRESULT MFCreateMemoryBuffer(DWORD maxLength, IMFMediaBuffer** buffer) {
  if (!buffer) return E_POINTER;
  *buffer = nullptr;
  ComPtr<platform::MemoryBuffer> created;
  created.Attach(new platform::MemoryBuffer(maxLength));
  if (!created->valid()) return E_OUTOFMEMORY;
  *buffer = created.Detach();
  return S_OK;
}

HRESULT MFCreateSample(IMFSample** sample) {
  if (!sample) return E_POINTER;
  *sample = new platform::Sample();
  return S_OK;
}

HRESULT MFCreateCollection(IMFCollection** collection) {
  if (!collection) return E_POINTER;
  *collection = new platform::Collection();
  return S_OK;
}
