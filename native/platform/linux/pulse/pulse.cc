#include "platform/linux/pulse/pulse.h"

namespace platform::pulse {

namespace {

void signalOperation(pa_operation*, void* loop) {
  pa_threaded_mainloop_signal(static_cast<pa_threaded_mainloop*>(loop), 0);
}

Sink sinkOf(const pa_sink_info* info) {
  Sink sink;
  sink.name = info->name ? info->name : "";
  sink.description = info->description ? info->description : sink.name;
  sink.monitor = info->monitor_source_name ? info->monitor_source_name : "";
  sink.sampleSpec = info->sample_spec;
  sink.map = info->channel_map;
  return sink;
}

struct SinkQuery {
  pa_threaded_mainloop* loop;
  std::vector<Sink> found;
};

void collectSink(pa_context*, const pa_sink_info* info, int eol, void* data) {
  auto* query = static_cast<SinkQuery*>(data);
  if (eol == 0 && info)
    query->found.push_back(sinkOf(info));
  else
    pa_threaded_mainloop_signal(query->loop, 0);
}

struct ServerQuery {
  pa_threaded_mainloop* loop;
  std::string defaultSink;
};

void readServer(pa_context*, const pa_server_info* info, void* data) {
  auto* query = static_cast<ServerQuery*>(data);
  if (info && info->default_sink_name) query->defaultSink = info->default_sink_name;
  pa_threaded_mainloop_signal(query->loop, 0);
}

}  // namespace

void Connection::stateChanged(pa_context* context, void* data) {
  auto* connection = static_cast<Connection*>(data);
  connection->state_.store(pa_context_get_state(context), std::memory_order_release);
  pa_threaded_mainloop_signal(connection->loop_, 0);
}

Connection::Connection() {
  loop_ = pa_threaded_mainloop_new();
  if (!loop_) return;
  // Our own name, so per-thread figures tell this loop from other libraries' PulseAudio loops.
  pa_threaded_mainloop_set_name(loop_, "tavio-pulse");
  context_ = pa_context_new(pa_threaded_mainloop_get_api(loop_), "tavio_capture");
  if (!context_) return;
  pa_context_set_state_callback(context_, stateChanged, this);
  if (pa_context_connect(context_, nullptr, PA_CONTEXT_NOAUTOSPAWN, nullptr) < 0) return;
  if (pa_threaded_mainloop_start(loop_) < 0) return;
  pa_threaded_mainloop_lock(loop_);
  for (;;) {
    pa_context_state_t state = pa_context_get_state(context_);
    if (state == PA_CONTEXT_READY || !PA_CONTEXT_IS_GOOD(state)) break;
    pa_threaded_mainloop_wait(loop_);
  }
  pa_threaded_mainloop_unlock(loop_);
}

Connection::~Connection() {
  if (loop_) pa_threaded_mainloop_stop(loop_);
  if (context_) {
    pa_context_set_state_callback(context_, nullptr, nullptr);
    pa_context_disconnect(context_);
    pa_context_unref(context_);
  }
  if (loop_) pa_threaded_mainloop_free(loop_);
}

bool Connection::connected() { return context_ && ready(); }

bool Connection::wait(pa_operation* operation) {
  if (!operation) return false;
  pa_operation_set_state_callback(operation, signalOperation, loop_);
  pa_operation_state_t state;
  while ((state = pa_operation_get_state(operation)) == PA_OPERATION_RUNNING) pa_threaded_mainloop_wait(loop_);
  pa_operation_set_state_callback(operation, nullptr, nullptr);
  pa_operation_unref(operation);
  return state == PA_OPERATION_DONE;
}

std::vector<Sink> Connection::sinks() {
  if (!connected()) return {};
  Lock lock(*this);
  SinkQuery query{loop_, {}};
  if (!wait(pa_context_get_sink_info_list(context_, collectSink, &query))) return {};
  return query.found;
}

bool Connection::findSink(const std::string& name, Sink& sink) {
  if (!connected()) return false;
  Lock lock(*this);
  SinkQuery query{loop_, {}};
  if (!wait(pa_context_get_sink_info_by_name(context_, name.c_str(), collectSink, &query))) return false;
  if (query.found.empty()) return false;
  sink = query.found.front();
  return true;
}

bool Connection::defaultSink(Sink& sink) {
  if (!connected()) return false;
  ServerQuery query{loop_, {}};
  {
    Lock lock(*this);
    if (!wait(pa_context_get_server_info(context_, readServer, &query))) return false;
  }
  return !query.defaultSink.empty() && findSink(query.defaultSink, sink);
}

}  // namespace platform::pulse
