#include "platform/linux/pulse/sourcewatch.h"

namespace platform::pulse {

SourceWatch::SourceWatch(const std::string& name) {
  loop_ = pa_mainloop_new();
  if (!loop_) return;
  context_ = pa_context_new(pa_mainloop_get_api(loop_), "tavio_capture microphone");
  if (!context_ || pa_context_connect(context_, nullptr, PA_CONTEXT_NOAUTOSPAWN, nullptr) < 0) return;
  pa_context_state_t state;
  while ((state = pa_context_get_state(context_)) != PA_CONTEXT_READY)
    if (!PA_CONTEXT_IS_GOOD(state) || pa_mainloop_iterate(loop_, 1, nullptr) < 0) return;
  pa_context_set_subscribe_callback(context_, onEvent, this);
  // Subscribed before the look-up, so that a source going right after it is seen.
  if (!runUntilDone(pa_context_subscribe(context_, PA_SUBSCRIPTION_MASK_SOURCE, nullptr, nullptr))) return;
  runUntilDone(pa_context_get_source_info_by_name(context_, name.c_str(), onSource, this));
}

SourceWatch::~SourceWatch() {
  if (context_) {
    pa_context_set_subscribe_callback(context_, nullptr, nullptr);
    pa_context_disconnect(context_);
    pa_context_unref(context_);
  }
  if (loop_) pa_mainloop_free(loop_);
}

bool SourceWatch::present() {
  if (index_ == PA_INVALID_INDEX || gone_) return false;
  while (pa_mainloop_iterate(loop_, 0, nullptr) > 0) {
  }
  if (!PA_CONTEXT_IS_GOOD(pa_context_get_state(context_))) gone_ = true;
  return !gone_;
}

bool SourceWatch::runUntilDone(pa_operation* operation) {
  if (!operation) return false;
  bool running = true;
  while ((running = pa_operation_get_state(operation) == PA_OPERATION_RUNNING))
    if (pa_mainloop_iterate(loop_, 1, nullptr) < 0) break;
  pa_operation_unref(operation);
  return !running;
}

void SourceWatch::onSource(pa_context*, const pa_source_info* info, int eol, void* watch) {
  if (eol == 0 && info) static_cast<SourceWatch*>(watch)->index_ = info->index;
}

void SourceWatch::onEvent(pa_context*, pa_subscription_event_type_t type, uint32_t index, void* data) {
  auto* watch = static_cast<SourceWatch*>(data);
  if ((type & PA_SUBSCRIPTION_EVENT_FACILITY_MASK) == PA_SUBSCRIPTION_EVENT_SOURCE &&
      (type & PA_SUBSCRIPTION_EVENT_TYPE_MASK) == PA_SUBSCRIPTION_EVENT_REMOVE && index == watch->index_)
    watch->gone_ = true;
}

}  // namespace platform::pulse
