// The Linux Direct3D 11 objects behind the declarations in dxgi.h, shared by the device and the
// desktop duplication.
#pragma once

#include <cstdint>
#include <memory>
#include <mutex>

#include "platform/linux/dxgi.h"

namespace platform::d3d11 {

// Texture pixels in a memfd, so an X server can write into them through MIT-SHM.
class TextureMemory {
 public:
  static std::shared_ptr<TextureMemory> create(size_t size);
  ~TextureMemory();
  uint8_t* data() const { return data_; }
  size_t size() const { return size_; }
  int fd() const { return fd_; }
  // Counts writes by copies and mappings, so a grab knows whether the pixels are still its own.
  uint64_t writes() const { return writes_; }
  void written() { ++writes_; }

 private:
  TextureMemory(int fd, uint8_t* data, size_t size) : fd_(fd), data_(data), size_(size) {}
  int fd_;
  uint8_t* data_;
  size_t size_;
  uint64_t writes_ = 0;
};

class Texture : public platform::ComObject<ID3D11Texture2D, IID_ID3D11Resource, IID_ID3D11Texture2D> {
 public:
  explicit Texture(const D3D11_TEXTURE2D_DESC& desc, std::shared_ptr<TextureMemory> memory = nullptr)
      : desc_(desc), memory_(std::move(memory)) {}
  void GetDesc(D3D11_TEXTURE2D_DESC* desc) override { *desc = desc_; }

  const D3D11_TEXTURE2D_DESC& desc() const { return desc_; }
  // Pixels in CPU memory, rows packed at Width * 4 bytes; null for the desktop image.
  const std::shared_ptr<TextureMemory>& memory() const { return memory_; }
  // Writes this texture's pixels into `destination`, which has the same size and CPU memory.
  virtual void copyTo(Texture& destination);

 private:
  D3D11_TEXTURE2D_DESC desc_;
  std::shared_ptr<TextureMemory> memory_;
};

class Context : public platform::ComObject<ID3D11DeviceContext, IID_ID3D11DeviceContext> {
 public:
  void CopyResource(ID3D11Resource* destination, ID3D11Resource* source) override;
  HRESULT Map(ID3D11Resource* resource, UINT subresource, D3D11_MAP mapType, UINT mapFlags,
              D3D11_MAPPED_SUBRESOURCE* mapped) override;
};

// A device answers for ID3D11Device and ID3D10Multithread.
class Device : public ID3D11Device, public ID3D10Multithread {
 public:
  explicit Device(D3D_FEATURE_LEVEL level);
  HRESULT QueryInterface(REFIID riid, void** object) override;
  ULONG AddRef() override { return ++references_; }
  ULONG Release() override;

  HRESULT CreateTexture2D(const D3D11_TEXTURE2D_DESC* desc, const D3D11_SUBRESOURCE_DATA* initialData,
                          ID3D11Texture2D** texture) override;
  void GetImmediateContext(ID3D11DeviceContext** context) override;
  D3D_FEATURE_LEVEL GetFeatureLevel() override { return level_; }

  BOOL SetMultithreadProtected(BOOL protect) override { return protected_.exchange(protect != FALSE) ? TRUE : FALSE; }

 private:
  ~Device() override;
  std::atomic<ULONG> references_{1};
  D3D_FEATURE_LEVEL level_;
  ComPtr<Context> context_;
  std::atomic<bool> protected_{false};
};

}  // namespace platform::d3d11
