// Test cameras are lavfi graphs named in an environment variable; lavfi can also read and write
// files (movie=, amovie=, drawtext=textfile=, metadata=...:file=), which a test camera must never
// do. Only picture generators, followed by filters that only draw or reshape pictures, are taken.
#pragma once

#include <string>
#include <vector>

namespace platform::testcamera {

// The filter names of a lavfi graph in order, read as FFmpeg's graph parser reads them: filters
// separated by ',' or ';' outside quotes and escapes, a name ending at '=' or at '@' (an instance
// name), link labels in brackets left out.
std::vector<std::string> filterNames(const std::string& graph);

// The first filter of the graph that a test camera may not use, or "" when it may use them all.
std::string refusedFilter(const std::string& graph);

}  // namespace platform::testcamera
