#include "platform/linux/pulse/sourcewatch.h"

namespace platform::pulse {

SourceWatch::SourceWatch(const std::string& name) {
  if (!connection_.connected()) return;
  pa_context* context = connection_.context();
  pa_context_set_subscribe_callback(context, onEvent, this);
  // Subscribed before the look-up, so that a source going right after it is seen.
  if (connection_.run(pa_context_subscribe(context, PA_SUBSCRIPTION_MASK_SOURCE, nullptr, nullptr)))
    connection_.run(pa_context_get_source_info_by_name(context, name.c_str(), onSource, this));
}

bool SourceWatch::present() {
  if (index_ == PA_INVALID_INDEX || gone_) return false;
  connection_.dispatch();
  gone_ = gone_ || !connection_.connected();
  return !gone_;
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
