// Messages to windows on X11: a window handle is an X window id. A posted message becomes a
// client message of type TAVIO_WINDOW_MESSAGE to that window (data: message, wParam, lParam);
// bringing a window forward is an EWMH _NET_ACTIVE_WINDOW request to the window manager.
#include <xcb/xcb.h>

#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <memory>

#include "platform/linux/user32.h"

namespace {

struct Connection {
  xcb_connection_t* connection = xcb_connect(nullptr, nullptr);
  ~Connection() { xcb_disconnect(connection); }
  bool ok() const { return xcb_connection_has_error(connection) == 0; }
};

xcb_window_t windowId(HWND window) { return static_cast<xcb_window_t>(reinterpret_cast<uintptr_t>(window)); }

bool windowExists(xcb_connection_t* connection, xcb_window_t window) {
  auto* reply = xcb_get_window_attributes_reply(connection, xcb_get_window_attributes(connection, window), nullptr);
  std::free(reply);
  return reply != nullptr;
}

xcb_atom_t atom(xcb_connection_t* connection, const char* name) {
  auto* reply = xcb_intern_atom_reply(connection, xcb_intern_atom(connection, 0, std::strlen(name), name), nullptr);
  const xcb_atom_t result = reply ? reply->atom : static_cast<xcb_atom_t>(XCB_ATOM_NONE);
  std::free(reply);
  return result;
}

bool sendClientMessage(xcb_connection_t* connection, xcb_window_t destination, xcb_window_t window, xcb_atom_t type,
                       uint32_t eventMask, const uint32_t (&data)[5]) {
  xcb_client_message_event_t event{};
  event.response_type = XCB_CLIENT_MESSAGE;
  event.format = 32;
  event.window = window;
  event.type = type;
  for (int i = 0; i < 5; ++i) event.data.data32[i] = data[i];
  xcb_void_cookie_t cookie =
      xcb_send_event_checked(connection, 0, destination, eventMask, reinterpret_cast<const char*>(&event));
  xcb_generic_error_t* error = xcb_request_check(connection, cookie);
  std::free(error);
  return error == nullptr;
}

}  // namespace

BOOL PostMessageA(HWND window, UINT message, WPARAM wParam, LPARAM lParam) {
  // A null window means the calling thread's own queue, which always takes the message; nothing
  // in this process reads such a queue on Linux, so there is nothing more to do.
  if (!window) return TRUE;
  Connection x;
  if (!x.ok() || !windowExists(x.connection, windowId(window))) {
    SetLastError(ERROR_INVALID_WINDOW_HANDLE);
    return FALSE;
  }
  const uint32_t data[5] = {message, static_cast<uint32_t>(wParam), static_cast<uint32_t>(lParam), 0, 0};
  if (!sendClientMessage(x.connection, windowId(window), windowId(window), atom(x.connection, "TAVIO_WINDOW_MESSAGE"),
                         XCB_EVENT_MASK_NO_EVENT, data)) {
    SetLastError(ERROR_INVALID_WINDOW_HANDLE);
    return FALSE;
  }
  return TRUE;
}

BOOL SetForegroundWindow(HWND window) {
  if (!window) return FALSE;
  Connection x;
  if (!x.ok() || !windowExists(x.connection, windowId(window))) return FALSE;
  const xcb_window_t root = xcb_setup_roots_iterator(xcb_get_setup(x.connection)).data->root;
  const uint32_t data[5] = {1 /* request from an application */, XCB_CURRENT_TIME, 0, 0, 0};
  return sendClientMessage(x.connection, root, windowId(window), atom(x.connection, "_NET_ACTIVE_WINDOW"),
                           XCB_EVENT_MASK_SUBSTRUCTURE_REDIRECT | XCB_EVENT_MASK_SUBSTRUCTURE_NOTIFY, data)
             ? TRUE
             : FALSE;
}
