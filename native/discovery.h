// The start-up discovery of initialize, apart from Node: cameras, camera microphones, audio
// endpoints and displays, in that uid order.
#pragma once

#include <memory>
#include <vector>

#include "capture/source.h"

namespace capture {

using SourceList = std::vector<std::shared_ptr<Source>>;

// Appends what it finds to `sources` and starts capture and previews of the new cameras,
// microphones and endpoints (displays are kept capturing by the caller's pump). A failure of a
// whole family (no default endpoint, say) throws, and what was found before it stays appended.
void discoverSources(SourceList& sources);

}  // namespace capture
