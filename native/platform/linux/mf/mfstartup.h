// The start-up count of the Linux Media Foundation layer, for the objects that need a started
// platform.
#pragma once

namespace platform {

// True while more MFStartup calls than MFShutdown calls have succeeded.
bool mediaFoundationStarted();

}  // namespace platform
