// One connection to the PulseAudio server (PipeWire's PulseAudio server serves as well), shared by
// an enumerator, its endpoints and their audio clients. Its threaded main loop runs the server's
// callbacks on a thread of libpulse.
#pragma once

#include <pulse/pulseaudio.h>

#include <atomic>
#include <memory>
#include <string>
#include <vector>

namespace platform::pulse {

// What the layer needs to know about one sink.
struct Sink {
  std::string name;
  std::string description;
  std::string monitor;
  pa_sample_spec sampleSpec{};
  pa_channel_map map{};
};

class Connection {
 public:
  // Connects without autospawn: a missing server stays missing. Check connected().
  Connection();
  ~Connection();
  Connection(const Connection&) = delete;
  Connection& operator=(const Connection&) = delete;

  bool connected();
  // The context's state as its callback last saw it: callers on every poll need no libpulse call
  // (each one checks for a fork with a system call).
  bool ready() const { return state_.load(std::memory_order_acquire) == PA_CONTEXT_READY; }
  // Both false when the server is gone or not there.
  bool defaultSink(Sink& sink);
  bool findSink(const std::string& name, Sink& sink);
  std::vector<Sink> sinks();

  pa_threaded_mainloop* loop() { return loop_; }
  pa_context* context() { return context_; }

  // Runs an operation to its end; the caller holds the loop lock. False when it was cancelled.
  bool wait(pa_operation* operation);

 private:
  pa_threaded_mainloop* loop_ = nullptr;
  pa_context* context_ = nullptr;
  std::atomic<pa_context_state_t> state_{PA_CONTEXT_UNCONNECTED};

  static void stateChanged(pa_context* context, void* connection);
};

// Holds the main loop lock for a scope.
class Lock {
 public:
  explicit Lock(Connection& connection) : loop_(connection.loop()) { pa_threaded_mainloop_lock(loop_); }
  ~Lock() { pa_threaded_mainloop_unlock(loop_); }
  Lock(const Lock&) = delete;
  Lock& operator=(const Lock&) = delete;

 private:
  pa_threaded_mainloop* loop_;
};

}  // namespace platform::pulse
