#include "platform/linux/capture/devicereader.h"

#include <pthread.h>

extern "C" {
#include <libavformat/avformat.h>
#include <libavutil/time.h>
}

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <mutex>
#include <thread>

namespace platform::capturedevice {

struct DeviceReader::Shared {
  std::atomic<bool> stop{false};
  std::mutex mutex;
  std::condition_variable ended;
  bool done = false;
};

DeviceReader::DeviceReader(std::shared_ptr<Input> input, Deliver deliver, bool waitOnStop)
    : shared_(std::make_shared<Shared>()), waitOnStop_(waitOnStop) {
  std::thread([shared = shared_, input = std::move(input), deliver = std::move(deliver)]() mutable {
    pthread_setname_np(pthread_self(), "tavio-reader");
    while (!shared->stop.load()) {
      AVPacket* packet = av_packet_alloc();
      int error = packet ? av_read_frame(input->format, packet) : AVERROR(ENOMEM);
      const int64_t readAt = av_gettime_relative();
      // A microphone whose source has gone reads another source's sound now: its device is lost.
      if (error >= 0 && input->watch && !input->watch->present()) error = AVERROR(ENODEV);
      if (shared->stop.load()) {
        av_packet_free(&packet);
        break;
      }
      if (error == AVERROR(EAGAIN)) {  // a non-blocking device with nothing yet
        av_packet_free(&packet);
        std::this_thread::sleep_for(std::chrono::milliseconds(5));
        continue;
      }
      if (error < 0) {
        av_packet_free(&packet);
        deliver(nullptr, readAt, error);
        break;
      }
      deliver(packet, readAt, 0);
    }
    input.reset();  // the device closes here, on the thread that read it
    deliver = nullptr;
    std::lock_guard<std::mutex> lock(shared->mutex);
    shared->done = true;
    shared->ended.notify_all();
  }).detach();
}

DeviceReader::~DeviceReader() {
  shared_->stop = true;
  if (!waitOnStop_) return;
  std::unique_lock<std::mutex> lock(shared_->mutex);
  shared_->ended.wait_for(lock, std::chrono::seconds(1), [this] { return shared_->done; });
}

}  // namespace platform::capturedevice
