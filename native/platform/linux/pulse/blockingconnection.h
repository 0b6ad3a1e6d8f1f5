// A connection to the PulseAudio server without a thread of its own: its main loop runs only while
// the thread that owns it waits for an answer or asks for what has come.
#pragma once

#include <pulse/pulseaudio.h>

namespace platform::pulse {

class BlockingConnection {
 public:
  // Connects without autospawn, under the client name `name`. Check connected().
  explicit BlockingConnection(const char* name);
  ~BlockingConnection();
  BlockingConnection(const BlockingConnection&) = delete;
  BlockingConnection& operator=(const BlockingConnection&) = delete;

  bool connected() const { return context_ && PA_CONTEXT_IS_GOOD(pa_context_get_state(context_)); }
  pa_context* context() { return context_; }
  // Runs an operation to its end; false when there was none or the connection broke first.
  bool run(pa_operation* operation);
  // Runs the callbacks of what the server has sent, without waiting.
  void dispatch();

 private:
  pa_mainloop* loop_ = nullptr;
  pa_context* context_ = nullptr;
};

}  // namespace platform::pulse
