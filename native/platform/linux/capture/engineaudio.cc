// The engine thread's sound: the microphone's buffers timed by when they were captured, shown to
// the preview as PCM and cut to each clip's start and stop.
#include "platform/linux/capture/enginethread.h"

extern "C" {
#include <libavutil/time.h>
#include <libswresample/swresample.h>
}

#include <algorithm>
#include <cstdlib>
#include <cstring>
#include <mutex>
#include <vector>

namespace platform::engine {

namespace {

// The pulse input stamps sound by the system clock, smoothed over its recent buffers: after a step
// of that clock its stamps stray by up to the step for about a second. Until they have settled,
// sound is timed by when it was read.
constexpr int64_t clockStep = 10000;        // µs the system clock moved against engine time
constexpr int64_t stampSettling = 3000000;  // µs after a step before stamps are believed again

}  // namespace

// Whether the microphone's next delivery may come by `due`: it is expected one of its recent
// longest pauses after its last. One that sends seconds at once is not waited for when its next
// lump is due after the grace, since the clip would get silence there all the same.
bool EngineThread::soundCanComeBy(int64_t due) const {
  int64_t longest = 0;
  for (size_t i = 1; i < soundArrivals_.size(); ++i)
    longest = std::max(longest, soundArrivals_[i] - soundArrivals_[i - 1]);
  return soundArrivals_.empty() || soundArrivals_.back() + longest <= due;
}

void EngineThread::deliverAudio(AVFrame* frame, int64_t pts, AVRational timeBase, int64_t readAt) {
  const DeviceFormat& f = state_->audio->current;
  const int channels = frame->ch_layout.nb_channels;
  const bool interleaved16 = frame->format == AV_SAMPLE_FMT_S16;
  const DWORD length = static_cast<DWORD>(frame->nb_samples * channels * 2);
  const LONGLONG duration = av_rescale(frame->nb_samples, ticksPerSecond, f.sampleRate);

  // The pulse input stamps a packet with the system clock (µs) of its first sample, from the
  // stream's latency. A new stream's first packet has come stamped as if captured from its arrival
  // on (PulseAudio's sine source: a two-second lump ahead of the clock); sound cannot end after it
  // was read.
  const int64_t span = frame->sample_rate > 0 ? av_rescale(frame->nb_samples, 1000000, frame->sample_rate) : 0;
  const int64_t wallOffset = av_gettime() - av_gettime_relative();
  if (wallOffset_ && std::llabs(wallOffset - wallOffset_) > clockStep) stampsFrom_ = readAt + stampSettling;
  wallOffset_ = wallOffset;
  const int64_t stamped = pts == AV_NOPTS_VALUE || readAt < stampsFrom_
                              ? INT64_MAX
                              : av_rescale_q(pts, timeBase, AVRational{1, 1000000}) - wallOffset;
  const int64_t capturedAt = std::min(stamped, readAt - span);
  // Kept for a clip that starts while this buffer's sound is still current.
  av_frame_unref(lastSound_);
  av_frame_ref(lastSound_, frame);
  lastSoundAt_ = capturedAt;
  for (Recording* recording : recordings()) recordSound(*recording, frame, capturedAt);

  if (interleaved16) {
    std::vector<ComPtr<IMFCaptureEngineOnSampleCallback>> callbacks;
    bool previewing;
    {
      std::lock_guard<std::mutex> lock(state_->mutex);
      previewing = state_->previewing;
      for (const SinkStream& stream : state_->previewStreams)
        if (!stream.video && stream.callback) callbacks.push_back(stream.callback);
    }
    if (previewing && !callbacks.empty()) {
      ComPtr<IMFSample> sample;
      if (SUCCEEDED(makeSample(
              length, capturedAt * 10, duration, [&](BYTE* data) { std::memcpy(data, frame->data[0], length); },
              sample.GetAddressOf())))
        for (auto& callback : callbacks) callback->OnSample(sample.Get());
    }
  }
}

// Only what was captured between the clip's start and stop goes in, cut inside the buffer, since a
// source may deliver seconds in one; a clip whose first sound comes after its start begins with
// silence up to it.
void EngineThread::recordSound(Recording& recording, AVFrame* frame, int64_t capturedAt) {
  if (!recording.hasAudio || FAILED(recording.failure)) return;
  const int channels = frame->ch_layout.nb_channels;
  const int rate = frame->sample_rate;
  const int count = frame->nb_samples;
  if (rate <= 0 || count <= 0) return;
  const int64_t end = capturedAt + av_rescale(count, 1000000, rate);
  const int64_t startAt = recording.startAt;
  const int64_t stopAt = recording.stopAt;
  int first = 0;
  int last = count;
  if (capturedAt < startAt)
    first =
        static_cast<int>(std::min<int64_t>(count, av_rescale_rnd(startAt - capturedAt, rate, 1000000, AV_ROUND_UP)));
  if (stopAt) last = static_cast<int>(std::clamp<int64_t>(av_rescale(stopAt - capturedAt, rate, 1000000), 0, count));
  if (stopAt && recording.audioReachedAt >= stopAt) return;  // the clip has all its sound
  recording.audioReachedAt = std::max(recording.audioReachedAt, end);
  if (recording.resampler && last > first) {
    // A source that stamps lumps of sound as if just captured gives stamps that overlap what the
    // clip already has: that sound is not written twice (a few ms of jitter are let be).
    const int64_t position = av_rescale(capturedAt - startAt, rate, 1000000) + first;
    const int64_t have = av_rescale(recording.audioSamples, rate, recording.audioRate);
    if (have - position > rate / 200) first = static_cast<int>(std::min<int64_t>(last, first + (have - position)));
  }
  if (last <= first) return;
  if (!recording.resampler) {
    AVChannelLayout out;
    av_channel_layout_default(&out, recording.audioChannels);
    swr_alloc_set_opts2(&recording.resampler, &out, AV_SAMPLE_FMT_S16, recording.audioRate, &frame->ch_layout,
                        static_cast<AVSampleFormat>(frame->format), frame->sample_rate, 0, nullptr);
    av_channel_layout_uninit(&out);
    if (!recording.resampler || swr_init(recording.resampler) < 0) {
      recording.failure = MF_E_INVALIDMEDIATYPE;
      return;
    }
    if (capturedAt > startAt) {
      const int64_t gap = av_rescale(capturedAt - startAt, recording.audioRate, 1000000);
      std::vector<uint8_t> silence(static_cast<size_t>(std::max<int64_t>(gap, 0)) * recording.audioChannels * 2, 0);
      if (gap > 0) writeSound(recording, silence.data(), static_cast<int>(gap));
    }
  }
  const AVSampleFormat format = static_cast<AVSampleFormat>(frame->format);
  const bool planar = av_sample_fmt_is_planar(format);
  const int skip = first * av_get_bytes_per_sample(format) * (planar ? 1 : channels);
  std::vector<const uint8_t*> in(planar ? channels : 1);
  for (size_t plane = 0; plane < in.size(); ++plane) in[plane] = frame->extended_data[plane] + skip;
  const int room = swr_get_out_samples(recording.resampler, last - first);
  std::vector<uint8_t> converted(static_cast<size_t>(room) * recording.audioChannels * 2);
  uint8_t* out[1] = {converted.data()};
  const int made = swr_convert(recording.resampler, out, room, in.data(), last - first);
  if (made > 0) writeSound(recording, converted.data(), made);
}

// Interleaved 16-bit samples at the clip's rate, placed after the ones before.
void EngineThread::writeSound(Recording& recording, const uint8_t* data, int samples) {
  const DWORD bytes = static_cast<DWORD>(samples * recording.audioChannels * 2);
  const LONGLONG time = av_rescale(recording.audioSamples, ticksPerSecond, recording.audioRate);
  const LONGLONG span = av_rescale(samples, ticksPerSecond, recording.audioRate);
  recording.audioSamples += samples;
  ComPtr<IMFSample> sample;
  if (SUCCEEDED(makeSample(
          bytes, time, span, [&](BYTE* to) { std::memcpy(to, data, bytes); }, sample.GetAddressOf())))
    write(recording, recording.audioStream, sample.Get());
}

}  // namespace platform::engine
