// The clips of a source that are not in their files yet: each holds a token from here until its
// file is closed, so that a host that ends can wait for them.
#pragma once

#include <chrono>
#include <condition_variable>
#include <memory>
#include <mutex>

namespace capture {

class UnfinishedClips {
 public:
  // The clip counts as unfinished until the last copy of its token is gone.
  std::shared_ptr<void> hold() {
    {
      std::lock_guard<std::mutex> lock(state_->mutex);
      ++state_->count;
    }
    return std::shared_ptr<void>(nullptr, [state = state_](void*) {
      {
        std::lock_guard<std::mutex> lock(state->mutex);
        --state->count;
      }
      state->none.notify_all();
    });
  }

  // Returns once every clip is in its file, or at the deadline.
  void waitUntil(std::chrono::steady_clock::time_point deadline) {
    std::unique_lock<std::mutex> lock(state_->mutex);
    state_->none.wait_until(lock, deadline, [this] { return state_->count == 0; });
  }

 private:
  // Shared with the tokens, which may outlive the source's own reference.
  struct State {
    std::mutex mutex;
    std::condition_variable none;
    int count = 0;
  };
  std::shared_ptr<State> state_ = std::make_shared<State>();
};

}  // namespace capture
