// Kernel32 on Linux. Events are a flag under a mutex with a condition variable; a power request
// holds a logind "idle" inhibitor (a file descriptor logind watches) while it is set.
#include "platform/linux/kernel32.h"

#include <dbus/dbus.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <cstdint>
#include <condition_variable>
#include <cstdio>
#include <mutex>
#include <string>

namespace {

// What a HANDLE of this layer points at. The handle holds one reference and every wait or
// signal in progress another, so CloseHandle while another thread waits leaves the object alive
// until that wait returns, as closing a handle does on Windows.
struct KernelObject {
  virtual ~KernelObject() = default;
  std::atomic<uint32_t> references{1};
};

void release(KernelObject* object) {
  if (object->references.fetch_sub(1, std::memory_order_acq_rel) == 1) delete object;
}

// A reference to the object behind a handle for the length of one call.
template <class T>
class HandleRef {
 public:
  explicit HandleRef(T* object) : object_(object) {
    if (object_) object_->references.fetch_add(1, std::memory_order_relaxed);
  }
  ~HandleRef() {
    if (object_) release(object_);
  }
  HandleRef(const HandleRef&) = delete;
  HandleRef& operator=(const HandleRef&) = delete;
  T* operator->() const { return object_; }
  explicit operator bool() const { return object_ != nullptr; }

 private:
  T* object_;
};

struct Event : KernelObject {
  std::mutex mutex;
  std::condition_variable changed;
  bool signalled = false;
  bool manualReset = false;
};

struct PowerRequest : KernelObject {
  ~PowerRequest() override {
    if (inhibitor >= 0) close(inhibitor);
    if (bus) {
      dbus_connection_close(bus);
      dbus_connection_unref(bus);
    }
  }
  DBusConnection* bus = nullptr;
  std::string reason;
  int inhibitor = -1;  // the inhibitor lasts while logind sees this descriptor open
};

bool invalid(HANDLE handle) { return handle == nullptr || handle == INVALID_HANDLE_VALUE; }

template <class T>
T* as(HANDLE handle) {
  if (invalid(handle)) return nullptr;
  return dynamic_cast<T*>(static_cast<KernelObject*>(handle));
}

const char* const login1 = "org.freedesktop.login1";

}  // namespace

HANDLE CreateEventA(LPSECURITY_ATTRIBUTES, BOOL manualReset, BOOL initialState, LPCSTR name) {
  if (name) {  // named events would be shared between processes; nothing here needs them
    SetLastError(ERROR_NOT_SUPPORTED);
    return nullptr;
  }
  auto* event = new Event;
  event->manualReset = manualReset != FALSE;
  event->signalled = initialState != FALSE;
  SetLastError(ERROR_SUCCESS);
  return static_cast<KernelObject*>(event);
}

BOOL SetEvent(HANDLE handle) {
  HandleRef<Event> event(as<Event>(handle));
  if (!event) {
    SetLastError(ERROR_INVALID_HANDLE);
    return FALSE;
  }
  {
    std::lock_guard<std::mutex> lock(event->mutex);
    event->signalled = true;
  }
  if (event->manualReset)
    event->changed.notify_all();
  else
    event->changed.notify_one();
  return TRUE;
}

BOOL ResetEvent(HANDLE handle) {
  HandleRef<Event> event(as<Event>(handle));
  if (!event) {
    SetLastError(ERROR_INVALID_HANDLE);
    return FALSE;
  }
  std::lock_guard<std::mutex> lock(event->mutex);
  event->signalled = false;
  return TRUE;
}

DWORD WaitForSingleObject(HANDLE handle, DWORD milliseconds) {
  HandleRef<Event> event(as<Event>(handle));
  if (!event) {
    SetLastError(ERROR_INVALID_HANDLE);
    return WAIT_FAILED;
  }
  std::unique_lock<std::mutex> lock(event->mutex);
  auto ready = [&event] { return event->signalled; };
  if (milliseconds == INFINITE) {
    event->changed.wait(lock, ready);
  } else if (!event->changed.wait_for(lock, std::chrono::milliseconds(milliseconds), ready)) {
    return WAIT_TIMEOUT;
  }
  if (!event->manualReset) event->signalled = false;  // an auto-reset event releases one waiter
  return WAIT_OBJECT_0;
}

BOOL CloseHandle(HANDLE handle) {
  if (invalid(handle)) {
    SetLastError(ERROR_INVALID_HANDLE);
    return FALSE;
  }
  release(static_cast<KernelObject*>(handle));
  return TRUE;
}

HANDLE PowerCreateRequest(PREASON_CONTEXT context) {
  if (!context || context->Version != POWER_REQUEST_CONTEXT_VERSION) {
    SetLastError(ERROR_INVALID_PARAMETER);
    return INVALID_HANDLE_VALUE;
  }
  DBusError error;
  dbus_error_init(&error);
  DBusConnection* bus = dbus_bus_get_private(DBUS_BUS_SYSTEM, &error);
  if (!bus) {
    dbus_error_free(&error);
    SetLastError(ERROR_NOT_SUPPORTED);
    return INVALID_HANDLE_VALUE;
  }
  dbus_connection_set_exit_on_disconnect(bus, FALSE);
  auto* request = new PowerRequest;
  request->bus = bus;
  // Without logind there is nobody to keep the machine awake: fail, as a system without power
  // management would, and let the caller carry on.
  if (!dbus_bus_name_has_owner(bus, login1, &error)) {
    dbus_error_free(&error);
    delete request;
    SetLastError(ERROR_NOT_SUPPORTED);
    return INVALID_HANDLE_VALUE;
  }
  if ((context->Flags & POWER_REQUEST_CONTEXT_SIMPLE_STRING) && context->Reason.SimpleReasonString)
    request->reason = platform::narrow(context->Reason.SimpleReasonString);
  SetLastError(ERROR_SUCCESS);
  return static_cast<KernelObject*>(request);
}

BOOL PowerSetRequest(HANDLE handle, POWER_REQUEST_TYPE) {
  PowerRequest* request = as<PowerRequest>(handle);
  if (!request) {
    SetLastError(ERROR_INVALID_HANDLE);
    return FALSE;
  }
  if (request->inhibitor >= 0) return TRUE;
  DBusMessage* call =
      dbus_message_new_method_call(login1, "/org/freedesktop/login1", "org.freedesktop.login1.Manager", "Inhibit");
  if (!call) {
    SetLastError(ERROR_NOT_ENOUGH_MEMORY);
    return FALSE;
  }
  const char* what = "idle";
  const char* who = "tavio_capture";
  const char* why = request->reason.c_str();
  const char* mode = "block";
  dbus_message_append_args(call, DBUS_TYPE_STRING, &what, DBUS_TYPE_STRING, &who, DBUS_TYPE_STRING, &why,
                           DBUS_TYPE_STRING, &mode, DBUS_TYPE_INVALID);
  DBusError error;
  dbus_error_init(&error);
  DBusMessage* reply = dbus_connection_send_with_reply_and_block(request->bus, call, 5000, &error);
  dbus_message_unref(call);
  int descriptor = -1;
  if (reply) {
    if (!dbus_message_get_args(reply, &error, DBUS_TYPE_UNIX_FD, &descriptor, DBUS_TYPE_INVALID)) descriptor = -1;
    dbus_message_unref(reply);
  }
  dbus_error_free(&error);
  if (descriptor < 0) {
    SetLastError(ERROR_ACCESS_DENIED);
    return FALSE;
  }
  request->inhibitor = descriptor;
  return TRUE;
}

BOOL PowerClearRequest(HANDLE handle, POWER_REQUEST_TYPE) {
  PowerRequest* request = as<PowerRequest>(handle);
  if (!request) {
    SetLastError(ERROR_INVALID_HANDLE);
    return FALSE;
  }
  if (request->inhibitor >= 0) {
    close(request->inhibitor);
    request->inhibitor = -1;
  }
  return TRUE;
}

void OutputDebugStringW(LPCWSTR text) {
  if (!text) return;
  std::string line = platform::narrow(text);
  std::fwrite(line.data(), 1, line.size(), stderr);
  std::fflush(stderr);
}

LPWSTR PathFindExtensionW(LPCWSTR path) {
  if (!path) return nullptr;
  const wchar_t* dot = nullptr;
  const wchar_t* p = path;
  for (; *p; ++p) {
    // A separator starts a new component; a space ends what could have been an extension.
    if (*p == L'\\' || *p == L'/' || *p == L' ')
      dot = nullptr;
    else if (*p == L'.')
      dot = p;
  }
  return const_cast<LPWSTR>(dot ? dot : p);
}
