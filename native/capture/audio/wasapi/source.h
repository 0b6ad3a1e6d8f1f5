#pragma once

#include <atomic>
#include <cstdint>
#include <deque>
#include <functional>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include "capture/audio/encoder.h"
#include "capture/audio/source.h"
#include "capture/unfinished.h"
#include "platform/wasapi.h"

namespace capture::audio::wasapi {

// What one audio playback endpoint plays, by loopback capture. A thread of its own plays silence
// into the endpoint for the life of the process, so loopback packets keep coming while nothing
// else plays. Sources live in std::shared_ptr: the capture thread holds its source.
class Source : public capture::audio::Source, public std::enable_shared_from_this<Source> {
 public:
  // Makes the encoder of one recording for a path and the capture format.
  using EncoderFactory = std::function<Encoder*(const std::string& path, const WAVEFORMATEXTENSIBLE* format)>;

  // Takes over the caller's reference to the endpoint. Starts the silence thread.
  Source(IMMDevice* endpoint, bool isSelected);
  Source(IMMDevice* endpoint, bool isSelected, EncoderFactory makeEncoder);
  ~Source() override;

  int32_t type() override;
  std::string name() override;
  void startPreview() override;
  void stopPreview() override;
  void capture() override;
  void stopCapturing() override;
  void startEncode(std::string filename) override;
  void stopEncode() override;
  void finishClips(std::chrono::steady_clock::time_point deadline) override;
  bool selected() override;

  // 0 until the capture thread has read the format.
  uint16_t channels() override;
  double peak(int32_t channel) override;

 private:
  struct Silence;
  struct Clip;

  // One try at capturing; it hands out the clients it made, for the caller to release if it fails.
  void runCapture(IAudioClient*& client, IAudioCaptureClient*& packets);
  // After a failed try: finishes the clips, zeroes the peaks and lets go of the try's clients.
  void endFailedTry(IAudioClient*& client, IAudioCaptureClient*& packets);
  // Gives every clip its part of the packet that covers [begin, begin + frames / rate) on the
  // capture clock, and finishes the clips that have reached their stop.
  void record(const BYTE* data, UINT32 frames, uint64_t begin, const WAVEFORMATEXTENSIBLE* captureFormat);
  // Finishes the clips whose stop lies far enough behind without packets reaching it.
  void finishOverdue(uint64_t now);
  // Moves the clips startEncode handed over into `writing`.
  void takeStarted();
  void finishAll(bool failed);
  void finish(Clip& clip, uint64_t end);
  void writeSilence(Clip& clip, uint64_t from, uint64_t until);

  ComPtr<IMMDevice> endpoint;
  // The newest capture thread's clients; each thread works with its own, and a later thread's
  // replace an earlier one's here without releasing them.
  std::atomic<IAudioClient*> audioClient{nullptr};
  std::atomic<IAudioCaptureClient*> captureClient{nullptr};
  // The silence thread's clients live with that thread, which may outlive the source.
  std::shared_ptr<Silence> silence;
  std::atomic<WAVEFORMATEXTENSIBLE*> format{nullptr};
  // Clips cover the capture-clock interval from their startEncode to their stopEncode. startEncode
  // hands a new clip to the capture thread through `started`; the thread writes each packet's part
  // of every clip it holds and finishes a clip once packets have passed its stop.
  std::mutex clipsLock;
  std::deque<std::shared_ptr<Clip>> started;   // guarded by clipsLock
  std::shared_ptr<Clip> latest;                // the caller's thread only
  std::vector<std::shared_ptr<Clip>> writing;  // the capture thread only
  capture::UnfinishedClips unfinished;
  EncoderFactory makeEncoder;
  bool isSelected;
  std::mutex peakLock;
  std::vector<double> peaks;
  std::atomic<bool> capturing{false};
  std::atomic<bool> previewing{false};
};

}  // namespace capture::audio::wasapi
