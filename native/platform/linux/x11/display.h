// X11 look-ups shared by the DXGI and User32 parts of the layer: connections, screens, RandR
// monitors, monitor descriptions and the HMONITOR encoding.
#pragma once

#include <xcb/randr.h>
#include <xcb/xcb.h>

#include <cstdint>
#include <memory>
#include <string>
#include <vector>

#include "platform/linux/com.h"

namespace platform::x11 {

using Connection = std::shared_ptr<xcb_connection_t>;

// A connection to the display `name` (empty: $DISPLAY); null when there is none or it fails.
Connection connect(const std::string& name);

// The display name a connection was made with: $DISPLAY at the time of the call.
std::string displayName();

int screenCount(xcb_connection_t* connection);
xcb_screen_t* screenOf(xcb_connection_t* connection, int index);

struct Monitor {
  xcb_atom_t name = 0;
  bool primary = false;
  int16_t x = 0, y = 0;
  uint16_t width = 0, height = 0;
  std::vector<xcb_randr_output_t> outputs;
};

// The active RandR monitors of a screen, in the server's order.
std::vector<Monitor> monitors(xcb_connection_t* connection, int screen);

// The monitor `name` of a screen; false when it is gone.
bool findMonitor(xcb_connection_t* connection, int screen, xcb_atom_t name, Monitor* monitor);

// The product name from the EDID of the monitor's first output that has one, else the RandR
// monitor name.
std::string describe(xcb_connection_t* connection, const Monitor& monitor);

// The monitor name in an EDID block (descriptor 0xFC); empty when it has none.
std::string edidProductName(const uint8_t* edid, size_t size);

// 1-based position of a monitor among the monitors of every screen, as in "\\.\DISPLAYn".
int displayNumber(xcb_connection_t* connection, int screen, xcb_atom_t name);
std::string displayDeviceName(int number);
// Parses "\\.\DISPLAYn" (a trailing "\Monitor0" is not accepted); 0 when it is no such name.
int parseDisplayDeviceName(const char* device);

// The screen and monitor at 1-based position `number`; false when there is none.
bool monitorByNumber(xcb_connection_t* connection, int number, int* screen, Monitor* monitor);

// An HMONITOR names a monitor by screen and name atom; atoms stay valid while the server runs.
HMONITOR monitorHandle(int screen, xcb_atom_t name);
bool decodeMonitorHandle(HMONITOR handle, int* screen, xcb_atom_t* name);

}  // namespace platform::x11
