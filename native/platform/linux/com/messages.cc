// FormatMessageA on Linux: the system's texts of the codes the add-on can meet. Codes Windows
// has no text for (WASAPI's AUDCLNT_E_* among them) are left out on purpose, so that callers
// fall back to their "Unknown error" form exactly as on Windows.
#include <cstdarg>
#include <cstring>

#include "platform/linux/com.h"

namespace {

struct Message {
  uint32_t code;
  const char* text;
};

// Win32 errors; an HRESULT of facility Win32 (0x8007xxxx) is looked up here by its low word.
const Message win32Messages[] = {
    {0, "The operation completed successfully."},
    {1, "Incorrect function."},
    {2, "The system cannot find the file specified."},
    {3, "The system cannot find the path specified."},
    {4, "The system cannot open the file."},
    {5, "Access is denied."},
    {6, "The handle is invalid."},
    {8, "Not enough memory resources are available to process this command."},
    {14, "Not enough memory resources are available to complete this operation."},
    {15, "The system cannot find the drive specified."},
    {19, "The media is write protected."},
    {21, "The device is not ready."},
    {31, "A device attached to the system is not functioning."},
    {32, "The process cannot access the file because it is being used by another process."},
    {33, "The process cannot access the file because another process has locked a portion of the file."},
    {39, "The disk is full."},
    {50, "The request is not supported."},
    {80, "The file exists."},
    {87, "The parameter is incorrect."},
    {112, "There is not enough space on the disk."},
    {122, "The data area passed to a system call is too small."},
    {123, "The filename, directory name, or volume label syntax is incorrect."},
    {170, "The requested resource is in use."},
    {183, "Cannot create a file when that file already exists."},
    {206, "The filename or extension is too long."},
    {258, "The wait operation timed out."},
    {267, "The directory name is invalid."},
    {1167, "The device is not connected."},
    {1168, "Element not found."},
    {1400, "Invalid window handle."},
    {1460, "This operation returned because the timeout period expired."},
};

const Message hresultMessages[] = {
    // COM
    {0x80004001, "Not implemented"},
    {0x80004002, "No such interface supported"},
    {0x80004003, "Invalid pointer"},
    {0x80004004, "Operation aborted"},
    {0x80004005, "Unspecified error"},
    {0x8000FFFF, "Catastrophic failure"},
    {0x80010106, "Cannot change thread mode after it is set."},
    {0x800401F0, "CoInitialize has not been called."},
    {0x80040110, "Class does not support aggregation (or class object is remote)"},
    {0x80040111, "ClassFactory cannot supply requested class"},
    {0x80040154, "Class not registered"},
    // DXGI
    {0x887A0001,
     "The application made a call that is invalid. Either the parameters of the call or the state of "
     "some object was incorrect.\r\nEnable the D3D debug layer in order to see details via debug messages."},
    {0x887A0002,
     "Object was not found. If calling IDXGIFactory::EnumAdaptes, there is no adapter with the "
     "specified ordinal."},
    {0x887A0003, "The caller did not supply a sufficiently large buffer."},
    {0x887A0004, "The specified device interface or feature level is not supported on this system."},
    {0x887A0005,
     "The GPU device instance has been suspended. Use GetDeviceRemovedReason to determine the "
     "appropriate action."},
    {0x887A0006,
     "The GPU will not respond to more commands, most likely because of an invalid command passed by "
     "the calling application."},
    {0x887A0007,
     "The GPU will not respond to more commands, most likely because some other application submitted "
     "invalid commands.\r\nThe calling application should re-create the device and continue."},
    {0x887A000A,
     "The GPU was busy at the moment when the call was made, and the call was neither executed nor "
     "scheduled."},
    {0x887A0022, "The requested functionality is not supported by the device or the driver."},
    {0x887A0026,
     "The desktop duplication interface is invalid. The desktop duplication interface typically "
     "becomes invalid when a different type of image is displayed on the desktop."},
    {0x887A0027, "The time-out interval elapsed before the next desktop frame was available."},
    {0x887A0028, "The Remote Desktop Services session is currently disconnected."},
    {0x887A002B,
     "You tried to use a resource to which you did not have the required access privileges. This error "
     "is most typically caused when you write to a shared resource with read-only access."},
    // Media Foundation
    {0xC00D36B0, "Platform not initialized. Please call MFStartup()."},
    {0xC00D36B1, "The buffer was too small to carry out the requested action."},
    {0xC00D36B2, "The request is invalid in the current state."},
    {0xC00D36B3, "The stream number provided was invalid."},
    {0xC00D36B4, "The data specified for the media type is invalid, inconsistent, or not supported by this object."},
    {0xC00D36B5, "The callee is currently not accepting further input."},
    {0xC00D36B6, "This object needs to be initialized before the requested operation can be carried out."},
    {0xC00D36B7, "The requested representation is not supported by this object."},
    {0xC00D36B9,
     "An object ran out of media types to suggest therefore the requested chain of streaming objects "
     "cannot be completed."},
    {0xC00D36BA, "The object does not support the specified service."},
    {0xC00D36BB, "An unexpected error has occurred in the operation requested."},
    {0xC00D36BC, "Invalid name."},
    {0xC00D36BD, "Invalid type."},
    {0xC00D36BE, "The file does not conform to the relevant file format specification."},
    {0xC00D36BF, "Invalid index."},
    {0xC00D36C0, "An invalid timestamp was given."},
    {0xC00D36C3, "The scheme of the given URL is unsupported."},
    {0xC00D36C4, "The byte stream type of the given URL is unsupported."},
    {0xC00D36C5, "The given time format is unsupported."},
    {0xC00D36C8, "The Media Sample does not have a timestamp."},
    {0xC00D36C9, "The Media Sample does not have a duration."},
    {0xC00D36CB, "The request failed because the data in the stream is corrupt."},
    {0xC00D36E6, "The requested attribute was not found."},
    {0xC00D36E7, "The specified attribute is not of the correct type."},
    {0xC00D36FA, "The requested object does not exist."},
    {0xC00D3E85, "The object's Shutdown method has already been called."},
    {0xC00D5212, "No suitable transform was found to encode or decode the content."},
    {0xC00D6D60, "A valid type has not been set for this stream or a stream that it depends on."},
    {0xC00DABE0, "The video recording device is no longer present."},
    {0xC00DABE1, "The video recording device is preempted by another immersive application."},
    {0xC00DABE2, "The video recording device is preempted by another application."},
    {0xC00DABE3, "The audio recording device is no longer present."},
};

const char* lookUp(uint32_t code) {
  if ((code & 0xFFFF0000u) == 0x80070000u || code < 0x10000u) {
    const uint32_t error = code & 0xFFFFu;
    for (const Message& m : win32Messages)
      if (m.code == error) return m.text;
    return nullptr;
  }
  for (const Message& m : hresultMessages)
    if (m.code == code) return m.text;
  return nullptr;
}

}  // namespace

// Supports what the add-on asks: FROM_SYSTEM, with or without ALLOCATE_BUFFER. Texts end in
// "\r\n" as Windows' do. Returns the length without the terminator, 0 when there is no text.
DWORD FormatMessageA(DWORD flags, LPCVOID, DWORD messageId, DWORD, LPSTR buffer, DWORD size, void*) {
  const char* found = (flags & FORMAT_MESSAGE_FROM_SYSTEM) ? lookUp(messageId) : nullptr;
  if (!found || !buffer) {
    SetLastError(found ? ERROR_INVALID_PARAMETER : 317 /* ERROR_MR_MID_NOT_FOUND */);
    return 0;
  }
  const size_t length = std::strlen(found) + 2;
  char* out;
  if (flags & FORMAT_MESSAGE_ALLOCATE_BUFFER) {
    out = static_cast<char*>(LocalAlloc(LMEM_FIXED, length + 1));
    *reinterpret_cast<char**>(buffer) = out;
  } else {
    if (size < length + 1) {
      SetLastError(122);
      return 0;
    }
    out = buffer;
  }
  std::memcpy(out, found, length - 2);
  std::memcpy(out + length - 2, "\r\n", 3);
  return static_cast<DWORD>(length);
}
