// The "new source" descriptor of a source, as ordered fields, independent of the JS engine.
#pragma once

#include <cstdint>
#include <string>
#include <utility>
#include <variant>
#include <vector>

#include "capture/source.h"

namespace capture {

using DescriptorValue = std::variant<int32_t, std::string>;
using Descriptor = std::vector<std::pair<std::string, DescriptorValue>>;

// The descriptor's "type" text of a source kind.
const char* typeName(int32_t type);

// "id", "name", "selected", "type", and for displays and cameras "pixelWidth", "width",
// "height", "size" (written twice, as the host has always received it).
Descriptor describeSource(int32_t uid, capture::Source& source);

}  // namespace capture
