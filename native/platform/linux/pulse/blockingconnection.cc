#include "platform/linux/pulse/blockingconnection.h"

namespace platform::pulse {

BlockingConnection::BlockingConnection(const char* name) {
  loop_ = pa_mainloop_new();
  if (!loop_) return;
  context_ = pa_context_new(pa_mainloop_get_api(loop_), name);
  if (!context_) return;
  if (pa_context_connect(context_, nullptr, PA_CONTEXT_NOAUTOSPAWN, nullptr) >= 0) {
    while (connected() && pa_context_get_state(context_) != PA_CONTEXT_READY)
      if (pa_mainloop_iterate(loop_, 1, nullptr) < 0) break;
  }
  if (pa_context_get_state(context_) != PA_CONTEXT_READY) {
    pa_context_unref(context_);
    context_ = nullptr;
  }
}

BlockingConnection::~BlockingConnection() {
  if (context_) {
    pa_context_set_subscribe_callback(context_, nullptr, nullptr);
    pa_context_disconnect(context_);
    pa_context_unref(context_);
  }
  if (loop_) pa_mainloop_free(loop_);
}

bool BlockingConnection::run(pa_operation* operation) {
  if (!operation) return false;
  bool running = true;
  while ((running = pa_operation_get_state(operation) == PA_OPERATION_RUNNING))
    if (pa_mainloop_iterate(loop_, 1, nullptr) < 0) break;
  pa_operation_unref(operation);
  return !running;
}

void BlockingConnection::dispatch() {
  if (!loop_) return;
  while (pa_mainloop_iterate(loop_, 0, nullptr) > 0) {
  }
}

}  // namespace platform::pulse
