// Scripted stand-ins for the DXGI and Direct3D 11 objects a display source uses. Each answers
// like Windows does for the cases the tests drive, and counts the calls they check.
#pragma once

#include <cstring>
#include <deque>
#include <functional>
#include <memory>
#include <vector>

#include "fakes/com.h"
#include "platform/dxgi.h"

namespace fakes {

// Reference counting that lets a test see whether the code under test released an object.
template <class I>
class Counted : public Stub<I> {
 public:
  HRESULT QueryInterface(REFIID riid, void** object) override {
    if (riid == IID_IUnknown || answers(riid)) {
      *object = this;
      AddRef();
      return S_OK;
    }
    *object = nullptr;
    return E_NOINTERFACE;
  }
  ULONG AddRef() override { return ++references; }
  ULONG Release() override { return --references; }  // tests own the objects
  virtual bool answers(REFIID riid) = 0;
  ULONG references = 1;
};

class Texture : public Counted<ID3D11Texture2D> {
 public:
  Texture(UINT width, UINT height) : width(width), height(height), pixels(size_t(width) * height * 4) {}
  void GetDesc(D3D11_TEXTURE2D_DESC* desc) override {
    *desc = {};
    desc->Width = width;
    desc->Height = height;
  }
  bool answers(REFIID riid) override { return riid == IID_ID3D11Resource || riid == IID_ID3D11Texture2D; }
  UINT width, height;
  std::vector<uint8_t> pixels;
};

// What AcquireNextFrame hands out: a resource that may or may not be a texture.
class Resource : public Counted<IDXGIResource> {
 public:
  explicit Resource(Texture* texture) : texture(texture) {}
  HRESULT QueryInterface(REFIID riid, void** object) override {
    if (riid == IID_ID3D11Texture2D) {
      if (!texture) return E_NOINTERFACE;
      texture->AddRef();
      *object = static_cast<ID3D11Texture2D*>(texture);
      return S_OK;
    }
    return Counted::QueryInterface(riid, object);
  }
  bool answers(REFIID riid) override { return riid == IID_IDXGIResource; }
  Texture* texture;
};

// Returns the scripted results in order; a held frame makes a second acquisition fail.
class Duplication : public Counted<IDXGIOutputDuplication> {
 public:
  struct Step {
    HRESULT result = S_OK;
    DXGI_OUTDUPL_FRAME_INFO info{};
  };
  explicit Duplication(Texture* desktop) : resource(desktop) {}
  void GetDesc(DXGI_OUTDUPL_DESC* desc) override { *desc = {}; }
  HRESULT AcquireNextFrame(UINT timeout, DXGI_OUTDUPL_FRAME_INFO* info, IDXGIResource** out) override {
    lastTimeout = timeout;
    *out = nullptr;
    if (held) return DXGI_ERROR_INVALID_CALL;
    Step step;
    if (!steps.empty()) {
      step = steps.front();
      steps.pop_front();
    } else {
      step.result = DXGI_ERROR_WAIT_TIMEOUT;
    }
    if (step.result == DXGI_ERROR_WAIT_TIMEOUT || step.result == DXGI_ERROR_ACCESS_LOST ||
        step.result == DXGI_ERROR_INVALID_CALL) {
      return step.result;
    }
    *info = step.info;
    held = true;
    resource.AddRef();
    *out = &resource;
    return step.result;
  }
  HRESULT GetFramePointerShape(UINT size, void* buffer, UINT* required,
                               DXGI_OUTDUPL_POINTER_SHAPE_INFO* info) override {
    *required = static_cast<UINT>(shape.size());
    if (size < shape.size()) return DXGI_ERROR_MORE_DATA;
    std::memcpy(buffer, shape.data(), shape.size());
    *info = shapeInfo;
    return S_OK;
  }
  HRESULT ReleaseFrame() override {
    ++releases;
    if (!held) return DXGI_ERROR_INVALID_CALL;
    held = false;
    return releaseResult;
  }
  bool answers(REFIID riid) override { return riid == IID_IDXGIOutputDuplication; }

  std::deque<Step> steps;
  std::vector<uint8_t> shape;
  DXGI_OUTDUPL_POINTER_SHAPE_INFO shapeInfo{};
  HRESULT releaseResult = S_OK;
  Resource resource;
  bool held = false;
  int releases = 0;
  UINT lastTimeout = 0;
};

class Context : public Counted<ID3D11DeviceContext> {
 public:
  void CopyResource(ID3D11Resource* destination, ID3D11Resource* source) override {
    ++copies;
    auto* to = static_cast<Texture*>(static_cast<ID3D11Texture2D*>(destination));
    auto* from = static_cast<Texture*>(static_cast<ID3D11Texture2D*>(source));
    if (to->pixels.size() == from->pixels.size()) to->pixels = from->pixels;
  }
  HRESULT Map(ID3D11Resource* resource, UINT, D3D11_MAP type, UINT, D3D11_MAPPED_SUBRESOURCE* mapped) override {
    if (FAILED(mapResult)) return mapResult;
    auto* texture = static_cast<Texture*>(static_cast<ID3D11Texture2D*>(resource));
    mapped->pData = texture->pixels.data();
    mapped->RowPitch = texture->width * 4;
    mapped->DepthPitch = 0;
    return S_OK;
  }
  bool answers(REFIID riid) override { return riid == IID_ID3D11DeviceContext; }
  HRESULT mapResult = S_OK;
  int copies = 0;
};

class Device : public Counted<ID3D11Device> {
 public:
  HRESULT CreateTexture2D(const D3D11_TEXTURE2D_DESC* desc, const D3D11_SUBRESOURCE_DATA*,
                          ID3D11Texture2D** texture) override {
    lastDesc = *desc;
    textures.push_back(std::make_unique<Texture>(desc->Width, desc->Height));
    *texture = textures.back().get();
    return S_OK;
  }
  void GetImmediateContext(ID3D11DeviceContext** out) override {
    context.AddRef();
    *out = &context;
  }
  D3D_FEATURE_LEVEL GetFeatureLevel() override { return D3D_FEATURE_LEVEL_11_0; }
  bool answers(REFIID riid) override { return riid == IID_ID3D11Device; }

  Context context;
  std::vector<std::unique_ptr<Texture>> textures;
  D3D11_TEXTURE2D_DESC lastDesc{};
};

// Hands out the duplications a test prepared, failing with the scripted codes first.
class Output : public Counted<IDXGIOutput1> {
 public:
  explicit Output(RECT rect) : rect(rect) {}
  HRESULT GetDesc(DXGI_OUTPUT_DESC* desc) override {
    *desc = {};
    desc->DesktopCoordinates = rect;
    desc->AttachedToDesktop = TRUE;
    return S_OK;
  }
  HRESULT DuplicateOutput(IUnknown*, IDXGIOutputDuplication** out) override {
    ++duplications;
    *out = nullptr;
    if (!failures.empty()) {
      HRESULT hr = failures.front();
      failures.pop_front();
      return hr;
    }
    if (next.empty()) return DXGI_ERROR_UNSUPPORTED;
    *out = next.front();
    next.pop_front();
    return S_OK;
  }
  bool answers(REFIID riid) override { return riid == IID_IDXGIOutput || riid == IID_IDXGIOutput1; }

  RECT rect;
  std::deque<HRESULT> failures;
  std::deque<IDXGIOutputDuplication*> next;
  int duplications = 0;
};

}  // namespace fakes
