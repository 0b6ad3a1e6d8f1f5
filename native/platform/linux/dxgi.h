// Linux declarations of the DXGI and Direct3D 11 subset the capture code calls. An adapter is an
// X screen of $DISPLAY, an output is a RandR monitor of that screen; duplication waits on DAMAGE
// and XFIXES events and grabs through MIT-SHM. A device and its textures live in CPU memory, so a
// device can be created without any X server.
#pragma once

#include "platform/linux/com.h"
#include "platform/linux/user32.h"

// Codes, with the values Windows gives them.
constexpr HRESULT DXGI_ERROR_INVALID_CALL = hresult(0x887A0001);
constexpr HRESULT DXGI_ERROR_NOT_FOUND = hresult(0x887A0002);
constexpr HRESULT DXGI_ERROR_MORE_DATA = hresult(0x887A0003);
constexpr HRESULT DXGI_ERROR_UNSUPPORTED = hresult(0x887A0004);
constexpr HRESULT DXGI_ERROR_ACCESS_LOST = hresult(0x887A0026);
constexpr HRESULT DXGI_ERROR_WAIT_TIMEOUT = hresult(0x887A0027);
constexpr HRESULT DXGI_ERROR_SESSION_DISCONNECTED = hresult(0x887A0028);

inline constexpr GUID IID_IDXGIObject = {0xaec22fb8, 0x76f3, 0x4639, {0x9b, 0xe0, 0x28, 0xeb, 0x43, 0xa6, 0x7a, 0x2e}};
inline constexpr GUID IID_IDXGIFactory = {0x7b7166ec, 0x21c7, 0x44ae, {0xb2, 0x1a, 0xc9, 0xae, 0x32, 0x1a, 0xe3, 0x69}};
inline constexpr GUID IID_IDXGIFactory1 = {
    0x770aae78, 0xf26f, 0x4dba, {0xa8, 0x29, 0x25, 0x3c, 0x83, 0xd1, 0xb3, 0x87}};
inline constexpr GUID IID_IDXGIAdapter = {0x2411e7e1, 0x12ac, 0x4ccf, {0xbd, 0x14, 0x97, 0x98, 0xe8, 0x53, 0x4d, 0xc0}};
inline constexpr GUID IID_IDXGIAdapter1 = {
    0x29038f61, 0x3839, 0x4626, {0x91, 0xfd, 0x08, 0x68, 0x79, 0x01, 0x1a, 0x05}};
inline constexpr GUID IID_IDXGIOutput = {0xae02eedb, 0xc735, 0x4690, {0x8d, 0x52, 0x5a, 0x8d, 0xc2, 0x02, 0x13, 0xaa}};
inline constexpr GUID IID_IDXGIOutput1 = {0x00cddea8, 0x939b, 0x4b83, {0xa3, 0x40, 0xa6, 0x85, 0x22, 0x66, 0x66, 0xcc}};
inline constexpr GUID IID_IDXGIOutputDuplication = {
    0x191cfac3, 0xa341, 0x470d, {0xb2, 0x6e, 0xa8, 0x64, 0xf4, 0x28, 0x31, 0x9c}};
inline constexpr GUID IID_IDXGIResource = {
    0x035f3ab4, 0x482e, 0x4e50, {0xb4, 0x1f, 0x8a, 0x7f, 0x8b, 0xd8, 0x96, 0x0b}};
inline constexpr GUID IID_ID3D11Device = {0xdb6f6ddb, 0xac77, 0x4e88, {0x82, 0x53, 0x81, 0x9d, 0xf9, 0xbb, 0xf1, 0x40}};
inline constexpr GUID IID_ID3D11DeviceContext = {
    0xc0bfa96c, 0xe089, 0x44fb, {0x8e, 0xaf, 0x26, 0xf8, 0x79, 0x61, 0x90, 0xda}};
inline constexpr GUID IID_ID3D11Resource = {
    0xdc8e63f3, 0xd12b, 0x4952, {0xb4, 0x7b, 0x5e, 0x45, 0x02, 0x6a, 0x86, 0x2d}};
inline constexpr GUID IID_ID3D11Texture2D = {
    0x6f15aaf2, 0xd208, 0x4e89, {0x9a, 0xb4, 0x48, 0x95, 0x35, 0xd3, 0x4f, 0x9c}};
inline constexpr GUID IID_ID3D10Multithread = {
    0x9b7e4e00, 0x342c, 0x4106, {0xa1, 0x9f, 0x4f, 0x27, 0x04, 0xf6, 0x89, 0xf0}};

enum DXGI_FORMAT : UINT { DXGI_FORMAT_UNKNOWN = 0, DXGI_FORMAT_B8G8R8A8_UNORM = 87 };
enum DXGI_MODE_ROTATION : UINT {
  DXGI_MODE_ROTATION_UNSPECIFIED = 0,
  DXGI_MODE_ROTATION_IDENTITY = 1,
  DXGI_MODE_ROTATION_ROTATE90 = 2,
  DXGI_MODE_ROTATION_ROTATE180 = 3,
  DXGI_MODE_ROTATION_ROTATE270 = 4,
};

struct DXGI_SAMPLE_DESC {
  UINT Count;
  UINT Quality;
};

struct DXGI_OUTPUT_DESC {
  WCHAR DeviceName[32];  // UTF-16 code units
  RECT DesktopCoordinates;
  BOOL AttachedToDesktop;
  DXGI_MODE_ROTATION Rotation;
  HMONITOR Monitor;
};

enum DXGI_OUTDUPL_POINTER_SHAPE_TYPE : UINT {
  DXGI_OUTDUPL_POINTER_SHAPE_TYPE_MONOCHROME = 1,
  DXGI_OUTDUPL_POINTER_SHAPE_TYPE_COLOR = 2,
  DXGI_OUTDUPL_POINTER_SHAPE_TYPE_MASKED_COLOR = 4,
};

struct DXGI_OUTDUPL_POINTER_POSITION {
  POINT Position;
  BOOL Visible;
};

struct DXGI_OUTDUPL_POINTER_SHAPE_INFO {
  UINT Type;
  UINT Width;
  UINT Height;
  UINT Pitch;
  POINT HotSpot;
};

struct DXGI_OUTDUPL_FRAME_INFO {
  LARGE_INTEGER LastPresentTime;
  LARGE_INTEGER LastMouseUpdateTime;
  UINT AccumulatedFrames;
  BOOL RectsCoalesced;
  BOOL ProtectedContentMaskedOut;
  DXGI_OUTDUPL_POINTER_POSITION PointerPosition;
  UINT TotalMetadataBufferSize;
  UINT PointerShapeBufferSize;
};

struct DXGI_MODE_DESC {
  UINT Width;
  UINT Height;
  struct {
    UINT Numerator;
    UINT Denominator;
  } RefreshRate;
  DXGI_FORMAT Format;
  UINT ScanlineOrdering;
  UINT Scaling;
};

struct DXGI_OUTDUPL_DESC {
  DXGI_MODE_DESC ModeDesc;
  DXGI_MODE_ROTATION Rotation;
  BOOL DesktopImageInSystemMemory;
};

// Direct3D 11.
enum D3D_DRIVER_TYPE : UINT {
  D3D_DRIVER_TYPE_UNKNOWN = 0,
  D3D_DRIVER_TYPE_HARDWARE = 1,
  D3D_DRIVER_TYPE_REFERENCE = 2,
  D3D_DRIVER_TYPE_NULL = 3,
  D3D_DRIVER_TYPE_SOFTWARE = 4,
  D3D_DRIVER_TYPE_WARP = 5,
};
enum D3D_FEATURE_LEVEL : UINT {
  D3D_FEATURE_LEVEL_9_1 = 0x9100,
  D3D_FEATURE_LEVEL_9_2 = 0x9200,
  D3D_FEATURE_LEVEL_9_3 = 0x9300,
  D3D_FEATURE_LEVEL_10_0 = 0xa000,
  D3D_FEATURE_LEVEL_10_1 = 0xa100,
  D3D_FEATURE_LEVEL_11_0 = 0xb000,
  D3D_FEATURE_LEVEL_11_1 = 0xb100,
};
constexpr UINT D3D11_SDK_VERSION = 7;
constexpr UINT D3D11_CREATE_DEVICE_BGRA_SUPPORT = 0x20;
constexpr UINT D3D11_CREATE_DEVICE_VIDEO_SUPPORT = 0x800;

enum D3D11_USAGE : UINT {
  D3D11_USAGE_DEFAULT = 0,
  D3D11_USAGE_IMMUTABLE = 1,
  D3D11_USAGE_DYNAMIC = 2,
  D3D11_USAGE_STAGING = 3,
};
enum D3D11_CPU_ACCESS_FLAG : UINT { D3D11_CPU_ACCESS_WRITE = 0x10000, D3D11_CPU_ACCESS_READ = 0x20000 };
enum D3D11_MAP : UINT {
  D3D11_MAP_READ = 1,
  D3D11_MAP_WRITE = 2,
  D3D11_MAP_READ_WRITE = 3,
  D3D11_MAP_WRITE_DISCARD = 4,
  D3D11_MAP_WRITE_NO_OVERWRITE = 5,
};

struct D3D11_TEXTURE2D_DESC {
  UINT Width;
  UINT Height;
  UINT MipLevels;
  UINT ArraySize;
  DXGI_FORMAT Format;
  DXGI_SAMPLE_DESC SampleDesc;
  D3D11_USAGE Usage;
  UINT BindFlags;
  UINT CPUAccessFlags;
  UINT MiscFlags;
};
struct D3D11_SUBRESOURCE_DATA {
  const void* pSysMem;
  UINT SysMemPitch;
  UINT SysMemSlicePitch;
};
struct D3D11_MAPPED_SUBRESOURCE {
  void* pData;
  UINT RowPitch;
  UINT DepthPitch;
};

struct IDXGIOutput;
struct IDXGIOutputDuplication;
struct ID3D11DeviceContext;

struct IDXGIObject : IUnknown {};

struct IDXGIResource : IDXGIObject {};

struct IDXGIOutput : IDXGIObject {
  virtual HRESULT GetDesc(DXGI_OUTPUT_DESC* desc) = 0;
};

struct IDXGIOutput1 : IDXGIOutput {
  // device: an ID3D11Device of the output's adapter (or one made without an adapter).
  virtual HRESULT DuplicateOutput(IUnknown* device, IDXGIOutputDuplication** duplication) = 0;
};

struct IDXGIAdapter : IDXGIObject {
  virtual HRESULT EnumOutputs(UINT index, IDXGIOutput** output) = 0;
};

struct IDXGIAdapter1 : IDXGIAdapter {};

struct IDXGIFactory : IDXGIObject {};

struct IDXGIFactory1 : IDXGIFactory {
  virtual HRESULT EnumAdapters1(UINT index, IDXGIAdapter1** adapter) = 0;
};

struct IDXGIOutputDuplication : IDXGIObject {
  virtual void GetDesc(DXGI_OUTDUPL_DESC* desc) = 0;
  virtual HRESULT AcquireNextFrame(UINT timeoutMilliseconds, DXGI_OUTDUPL_FRAME_INFO* frameInfo,
                                   IDXGIResource** desktopResource) = 0;
  virtual HRESULT GetFramePointerShape(UINT bufferSize, void* buffer, UINT* requiredSize,
                                       DXGI_OUTDUPL_POINTER_SHAPE_INFO* shapeInfo) = 0;
  virtual HRESULT ReleaseFrame() = 0;
};

struct ID3D11Resource : IUnknown {};

struct ID3D11Texture2D : ID3D11Resource {
  virtual void GetDesc(D3D11_TEXTURE2D_DESC* desc) = 0;
};

struct ID3D11Device : IUnknown {
  virtual HRESULT CreateTexture2D(const D3D11_TEXTURE2D_DESC* desc, const D3D11_SUBRESOURCE_DATA* initialData,
                                  ID3D11Texture2D** texture) = 0;
  virtual void GetImmediateContext(ID3D11DeviceContext** context) = 0;
  virtual D3D_FEATURE_LEVEL GetFeatureLevel() = 0;
};

struct ID3D11DeviceContext : IUnknown {
  virtual void CopyResource(ID3D11Resource* destination, ID3D11Resource* source) = 0;
  virtual HRESULT Map(ID3D11Resource* resource, UINT subresource, D3D11_MAP mapType, UINT mapFlags,
                      D3D11_MAPPED_SUBRESOURCE* mapped) = 0;
};

struct ID3D10Multithread : IUnknown {
  virtual BOOL SetMultithreadProtected(BOOL protect) = 0;
};

HRESULT CreateDXGIFactory1(REFIID riid, void** factory);

HRESULT D3D11CreateDevice(IDXGIAdapter* adapter, D3D_DRIVER_TYPE driverType, HMODULE software, UINT flags,
                          const D3D_FEATURE_LEVEL* featureLevels, UINT featureLevelCount, UINT sdkVersion,
                          ID3D11Device** device, D3D_FEATURE_LEVEL* featureLevel,
                          ID3D11DeviceContext** immediateContext);
