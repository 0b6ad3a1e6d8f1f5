#include "platform/linux/x11/display.h"

#include <cstdlib>
#include <cstring>

namespace platform::x11 {

namespace {

template <class T>
using Reply = std::unique_ptr<T, decltype(&std::free)>;

template <class T>
Reply<T> reply(T* value) {
  return Reply<T>(value, &std::free);
}

xcb_atom_t atom(xcb_connection_t* connection, const char* name) {
  auto r = reply(xcb_intern_atom_reply(connection, xcb_intern_atom(connection, 1, std::strlen(name), name), nullptr));
  return r ? r->atom : static_cast<xcb_atom_t>(XCB_ATOM_NONE);
}

std::string atomName(xcb_connection_t* connection, xcb_atom_t value) {
  auto r = reply(xcb_get_atom_name_reply(connection, xcb_get_atom_name(connection, value), nullptr));
  if (!r) return {};
  return std::string(xcb_get_atom_name_name(r.get()), xcb_get_atom_name_name_length(r.get()));
}

}  // namespace

std::string displayName() {
  const char* name = std::getenv("DISPLAY");
  return name ? name : "";
}

Connection connect(const std::string& name) {
  if (name.empty()) return nullptr;
  xcb_connection_t* connection = xcb_connect(name.c_str(), nullptr);
  if (xcb_connection_has_error(connection)) {
    xcb_disconnect(connection);
    return nullptr;
  }
  return Connection(connection, &xcb_disconnect);
}

int screenCount(xcb_connection_t* connection) { return xcb_setup_roots_length(xcb_get_setup(connection)); }

xcb_screen_t* screenOf(xcb_connection_t* connection, int index) {
  auto it = xcb_setup_roots_iterator(xcb_get_setup(connection));
  for (int i = 0; it.rem; ++i, xcb_screen_next(&it)) {
    if (i == index) return it.data;
  }
  return nullptr;
}

std::vector<Monitor> monitors(xcb_connection_t* connection, int screen) {
  std::vector<Monitor> result;
  xcb_screen_t* s = screenOf(connection, screen);
  if (!s) return result;
  auto r = reply(xcb_randr_get_monitors_reply(connection, xcb_randr_get_monitors(connection, s->root, 1), nullptr));
  if (!r) return result;
  for (auto it = xcb_randr_get_monitors_monitors_iterator(r.get()); it.rem; xcb_randr_monitor_info_next(&it)) {
    Monitor m;
    m.name = it.data->name;
    m.primary = it.data->primary != 0;
    m.x = it.data->x;
    m.y = it.data->y;
    m.width = it.data->width;
    m.height = it.data->height;
    const xcb_randr_output_t* outputs = xcb_randr_monitor_info_outputs(it.data);
    m.outputs.assign(outputs, outputs + xcb_randr_monitor_info_outputs_length(it.data));
    result.push_back(std::move(m));
  }
  return result;
}

bool findMonitor(xcb_connection_t* connection, int screen, xcb_atom_t name, Monitor* monitor) {
  for (auto& m : monitors(connection, screen)) {
    if (m.name == name) {
      *monitor = std::move(m);
      return true;
    }
  }
  return false;
}

std::string edidProductName(const uint8_t* edid, size_t size) {
  // Four 18-byte descriptors follow the base block's fixed fields; 0xFC is the product name.
  for (size_t offset = 54; offset + 18 <= size && offset <= 108; offset += 18) {
    const uint8_t* d = edid + offset;
    if (d[0] != 0 || d[1] != 0 || d[2] != 0 || d[3] != 0xFC) continue;
    std::string name(reinterpret_cast<const char*>(d + 5), 13);
    size_t end = name.find('\n');
    if (end != std::string::npos) name.resize(end);
    while (!name.empty() && name.back() == ' ') name.pop_back();
    return name;
  }
  return {};
}

std::string describe(xcb_connection_t* connection, const Monitor& monitor) {
  xcb_atom_t edid = atom(connection, "EDID");
  if (edid != XCB_ATOM_NONE) {
    for (xcb_randr_output_t output : monitor.outputs) {
      auto r = reply(xcb_randr_get_output_property_reply(
          connection, xcb_randr_get_output_property(connection, output, edid, XCB_ATOM_ANY, 0, 64, 0, 0), nullptr));
      if (!r || r->format != 8) continue;
      std::string name = edidProductName(xcb_randr_get_output_property_data(r.get()),
                                         xcb_randr_get_output_property_data_length(r.get()));
      if (!name.empty()) return name;
    }
  }
  return atomName(connection, monitor.name);
}

int displayNumber(xcb_connection_t* connection, int screen, xcb_atom_t name) {
  int number = 0;
  for (int s = 0; s < screenCount(connection); ++s) {
    for (const auto& m : monitors(connection, s)) {
      ++number;
      if (s == screen && m.name == name) return number;
    }
  }
  return 0;
}

bool monitorByNumber(xcb_connection_t* connection, int number, int* screen, Monitor* monitor) {
  int n = 0;
  for (int s = 0; s < screenCount(connection); ++s) {
    for (auto& m : monitors(connection, s)) {
      if (++n == number) {
        *screen = s;
        *monitor = std::move(m);
        return true;
      }
    }
  }
  return false;
}

std::string displayDeviceName(int number) { return "\\\\.\\DISPLAY" + std::to_string(number); }

int parseDisplayDeviceName(const char* device) {
  static const char prefix[] = "\\\\.\\DISPLAY";
  if (!device || std::strncmp(device, prefix, sizeof(prefix) - 1) != 0) return 0;
  const char* digits = device + sizeof(prefix) - 1;
  if (*digits < '1' || *digits > '9') return 0;
  int number = 0;
  for (; *digits; ++digits) {
    if (*digits < '0' || *digits > '9' || number > 100000) return 0;
    number = number * 10 + (*digits - '0');
  }
  return number;
}

HMONITOR monitorHandle(int screen, xcb_atom_t name) {
  // Screen + 1 in the upper half keeps the handle non-null.
  return reinterpret_cast<HMONITOR>((static_cast<uintptr_t>(screen + 1) << 32) | name);
}

bool decodeMonitorHandle(HMONITOR handle, int* screen, xcb_atom_t* name) {
  auto value = reinterpret_cast<uintptr_t>(handle);
  if ((value >> 32) == 0) return false;
  *screen = static_cast<int>(value >> 32) - 1;
  *name = static_cast<xcb_atom_t>(value & 0xFFFFFFFFu);
  return true;
}

}  // namespace platform::x11
