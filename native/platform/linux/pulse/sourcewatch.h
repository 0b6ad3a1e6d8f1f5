// Whether a PulseAudio source is still there. The server moves a record stream whose source goes
// away to another source instead of ending it, and connects one asked for a source that is gone
// to the default source (PipeWire's server as well): a microphone's reader would go on with some
// other device's sound and never learn that its own was lost.
#pragma once

#include <string>

#include "platform/linux/pulse/blockingconnection.h"

namespace platform::pulse {

// The server's events are read when present() asks, on the thread that asks. Used by one thread
// at a time.
class SourceWatch {
 public:
  // Connects and looks the source up by name.
  explicit SourceWatch(const std::string& name);

  // False once the source has gone or the server has, and when there was none to begin with.
  bool present();

 private:
  BlockingConnection connection_{"tavio_capture microphone"};
  uint32_t index_ = PA_INVALID_INDEX;
  bool gone_ = false;

  static void onSource(pa_context*, const pa_source_info* info, int eol, void* watch);
  static void onEvent(pa_context*, pa_subscription_event_type_t type, uint32_t index, void* watch);
};

}  // namespace platform::pulse
