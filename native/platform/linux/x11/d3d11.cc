// Direct3D 11 in CPU memory: devices, immediate contexts and textures.
#include <sys/mman.h>
#include <unistd.h>

#include <cstring>

#include "platform/linux/x11/d3d11objects.h"

namespace platform::d3d11 {

std::shared_ptr<TextureMemory> TextureMemory::create(size_t size) {
  int fd = memfd_create("tavio-texture", MFD_CLOEXEC);
  if (fd < 0) return nullptr;
  if (ftruncate(fd, static_cast<off_t>(size)) != 0) {
    close(fd);
    return nullptr;
  }
  void* data = mmap(nullptr, size, PROT_READ | PROT_WRITE, MAP_SHARED, fd, 0);
  if (data == MAP_FAILED) {
    close(fd);
    return nullptr;
  }
  return std::shared_ptr<TextureMemory>(new TextureMemory(fd, static_cast<uint8_t*>(data), size));
}

TextureMemory::~TextureMemory() {
  munmap(data_, size_);
  close(fd_);
}

void Texture::copyTo(Texture& destination) {
  if (memory_ && destination.memory()) {
    std::memcpy(destination.memory()->data(), memory_->data(), memory_->size());
    destination.memory()->written();
  }
}

void Context::CopyResource(ID3D11Resource* destination, ID3D11Resource* source) {
  auto* to = dynamic_cast<Texture*>(destination);
  auto* from = dynamic_cast<Texture*>(source);
  if (!to || !from || to == from || !to->memory()) return;
  // Like Direct3D, resources of different sizes are not copied.
  if (to->desc().Width != from->desc().Width || to->desc().Height != from->desc().Height) return;
  from->copyTo(*to);
}

HRESULT Context::Map(ID3D11Resource* resource, UINT subresource, D3D11_MAP mapType, UINT mapFlags,
                     D3D11_MAPPED_SUBRESOURCE* mapped) {
  auto* texture = dynamic_cast<Texture*>(resource);
  if (!texture || !mapped || subresource != 0 || !texture->memory()) return E_INVALIDARG;
  const D3D11_TEXTURE2D_DESC& desc = texture->desc();
  bool reads = mapType == D3D11_MAP_READ || mapType == D3D11_MAP_READ_WRITE;
  bool writes = mapType != D3D11_MAP_READ;
  if ((reads && !(desc.CPUAccessFlags & D3D11_CPU_ACCESS_READ)) ||
      (writes && !(desc.CPUAccessFlags & D3D11_CPU_ACCESS_WRITE))) {
    return E_INVALIDARG;
  }
  if (writes) texture->memory()->written();
  mapped->pData = texture->memory()->data();
  mapped->RowPitch = desc.Width * 4;
  mapped->DepthPitch = desc.Width * desc.Height * 4;
  return S_OK;
}

Device::Device(D3D_FEATURE_LEVEL level) : level_(level) { context_.Attach(new Context()); }

Device::~Device() = default;

ULONG Device::Release() {
  ULONG left = --references_;
  if (left == 0) delete this;
  return left;
}

HRESULT Device::QueryInterface(REFIID riid, void** object) {
  if (!object) return E_POINTER;
  if (riid == IID_IUnknown || riid == IID_ID3D11Device) {
    *object = static_cast<ID3D11Device*>(this);
  } else if (riid == IID_ID3D10Multithread) {
    *object = static_cast<ID3D10Multithread*>(this);
  } else {
    *object = nullptr;
    return E_NOINTERFACE;
  }
  AddRef();
  return S_OK;
}

HRESULT Device::CreateTexture2D(const D3D11_TEXTURE2D_DESC* desc, const D3D11_SUBRESOURCE_DATA* initialData,
                                ID3D11Texture2D** texture) {
  if (!desc || desc->Width == 0 || desc->Height == 0 || desc->Width > 16384 || desc->Height > 16384 ||
      desc->MipLevels > 1 || desc->ArraySize != 1 || desc->Format != DXGI_FORMAT_B8G8R8A8_UNORM ||
      desc->SampleDesc.Count != 1) {
    return E_INVALIDARG;
  }
  if (desc->Usage == D3D11_USAGE_IMMUTABLE && !initialData) return E_INVALIDARG;
  if (!texture) return S_FALSE;  // Direct3D's answer to a description check without a texture
  auto memory = TextureMemory::create(static_cast<size_t>(desc->Width) * desc->Height * 4);
  if (!memory) return E_OUTOFMEMORY;
  if (initialData && initialData->pSysMem) {
    for (UINT y = 0; y < desc->Height; ++y) {
      std::memcpy(memory->data() + static_cast<size_t>(y) * desc->Width * 4,
                  static_cast<const uint8_t*>(initialData->pSysMem) + static_cast<size_t>(y) * initialData->SysMemPitch,
                  static_cast<size_t>(desc->Width) * 4);
    }
  }
  *texture = new Texture(*desc, std::move(memory));
  return S_OK;
}

void Device::GetImmediateContext(ID3D11DeviceContext** context) {
  *context = context_.Get();
  context_->AddRef();  // the caller's reference
}

}  // namespace platform::d3d11

HRESULT D3D11CreateDevice(IDXGIAdapter* adapter, D3D_DRIVER_TYPE driverType, HMODULE software, UINT flags,
                          const D3D_FEATURE_LEVEL* featureLevels, UINT featureLevelCount, UINT sdkVersion,
                          ID3D11Device** device, D3D_FEATURE_LEVEL* featureLevel,
                          ID3D11DeviceContext** immediateContext) {
  // Direct3D's rules: an adapter goes with the unknown driver type, no adapter with a real one.
  if ((adapter && driverType != D3D_DRIVER_TYPE_UNKNOWN) || (!adapter && driverType == D3D_DRIVER_TYPE_UNKNOWN)) {
    return E_INVALIDARG;
  }
  if (sdkVersion != D3D11_SDK_VERSION || (featureLevels == nullptr && featureLevelCount != 0)) return E_INVALIDARG;
  D3D_FEATURE_LEVEL level = D3D_FEATURE_LEVEL_11_0;
  if (featureLevels) {
    // The first level asked for that the device reaches.
    UINT i = 0;
    while (i < featureLevelCount && featureLevels[i] > D3D_FEATURE_LEVEL_11_0) ++i;
    if (i == featureLevelCount) return E_INVALIDARG;
    level = featureLevels[i];
  }
  ComPtr<platform::d3d11::Device> created;
  created.Attach(new platform::d3d11::Device(level));
  if (featureLevel) *featureLevel = level;
  if (immediateContext) created->GetImmediateContext(immediateContext);
  if (device) *device = created.Detach();
  return S_OK;
}
