#include "platform/linux/ffmpeg/streamencoder.h"

#include <cerrno>

namespace platform::sinkwriter {

HRESULT fromErrno(int error) {
  switch (error) {
    case ENOENT:  // the file is being created, so what is missing is a folder
    case ENOTDIR: return HRESULT_FROM_WIN32(ERROR_PATH_NOT_FOUND);
    case EACCES:
    case EPERM:
    case EISDIR:  // Windows refuses to open a folder as a file with access denied
      return HRESULT_FROM_WIN32(ERROR_ACCESS_DENIED);
    case EROFS: return HRESULT_FROM_WIN32(ERROR_WRITE_PROTECT);
    case ENAMETOOLONG: return HRESULT_FROM_WIN32(ERROR_FILENAME_EXCED_RANGE);
    case ENOSPC:
    case EDQUOT: return HRESULT_FROM_WIN32(ERROR_DISK_FULL);
    case EBUSY:
    case ETXTBSY: return HRESULT_FROM_WIN32(ERROR_SHARING_VIOLATION);
    case EEXIST: return HRESULT_FROM_WIN32(ERROR_FILE_EXISTS);
    case EINVAL: return HRESULT_FROM_WIN32(ERROR_INVALID_NAME);
    case ENOMEM: return E_OUTOFMEMORY;
    default: return E_FAIL;
  }
}

HRESULT fromAv(int error) {
  if (error >= 0) return S_OK;
  if (error == AVERROR(ENOMEM)) return E_OUTOFMEMORY;
  if (error > -4096) return fromErrno(-error);  // AVERROR(errno)
  return E_FAIL;
}

UINT32 get32(IMFAttributes* attributes, REFGUID key, UINT32 fallback) {
  UINT32 value = 0;
  return attributes && SUCCEEDED(attributes->GetUINT32(key, &value)) ? value : fallback;
}

bool getPair(IMFAttributes* attributes, REFGUID key, UINT32* high, UINT32* low) {
  UINT64 packed = 0;
  if (!attributes || FAILED(attributes->GetUINT64(key, &packed))) return false;
  *high = static_cast<UINT32>(packed >> 32);
  *low = static_cast<UINT32>(packed);
  return true;
}

GUID getGuid(IMFAttributes* attributes, REFGUID key) {
  GUID value = GUID_NULL;
  if (attributes) attributes->GetGUID(key, &value);
  return value;
}

}  // namespace platform::sinkwriter
