// The audio client of a PulseAudio sink: loopback capture from the sink's monitor source, or
// playback into the sink.
#pragma once

#include <memory>
#include <string>

#include "platform/linux/pulse/pulse.h"
#include "platform/linux/wasapi.h"

namespace platform::wasapi {

// AUDCLNT_E_DEVICE_INVALIDATED when the sink is gone.
HRESULT createAudioClient(std::shared_ptr<pulse::Connection> connection, const std::string& sink, REFIID riid,
                          void** object);

// The performance-counter position of now: a monotonic clock in 100 ns units.
UINT64 performanceCounterPosition();

}  // namespace platform::wasapi
