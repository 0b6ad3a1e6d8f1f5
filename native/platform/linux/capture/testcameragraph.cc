#include "platform/linux/capture/testcameragraph.h"

#include <algorithm>
#include <iterator>

namespace platform::testcamera {

namespace {

// Sources that make pictures from their options alone.
const char* const generators[] = {"allrgb",      "allyuv",     "cellauto",   "color",      "gradients",
                                  "haldclutsrc", "life",       "mandelbrot", "mptestsrc",  "nullsrc",
                                  "pal75bars",   "pal100bars", "rgbtestsrc", "sierpinski", "smptebars",
                                  "smptehdbars", "testsrc",    "testsrc2",   "yuvtestsrc"};

// Filters after the source that have no option naming a file: drawing (geq by expressions),
// geometry, format and timing (format and realtime are the ones the engine appends itself;
// select leaves pictures out, as a camera that is slow to start or drops frames does).
const char* const pictureFilters[] = {"crop",  "drawbox", "drawgrid", "format",    "fps",      "geq",
                                      "hflip", "negate",  "null",     "pad",       "realtime", "rotate",
                                      "scale", "select",  "setsar",   "transpose", "vflip"};

bool listed(const char* const* begin, const char* const* end, const std::string& name) {
  return std::any_of(begin, end, [&](const char* entry) { return name == entry; });
}

}  // namespace

std::vector<std::string> filterNames(const std::string& graph) {
  std::vector<std::string> names;
  std::string name;
  bool inName = true;   // before the '=' or '@' of the current filter
  bool quoted = false;  // inside '...'
  int brackets = 0;     // inside a [label]
  auto next = [&] {
    names.push_back(name);
    name.clear();
    inName = true;
  };
  for (size_t i = 0; i < graph.size(); ++i) {
    const char c = graph[i];
    if (quoted) {
      if (c == '\'')
        quoted = false;
      else if (inName && !brackets)
        name += c;
      continue;
    }
    if (c == '\\') {  // an escaped character belongs to an option value (or a name, kept as is)
      if (inName && !brackets && i + 1 < graph.size()) name += graph[i + 1];
      ++i;
      continue;
    }
    if (c == '\'') {
      quoted = true;
      continue;
    }
    if (c == '[') {
      ++brackets;
      continue;
    }
    if (c == ']') {
      if (brackets) --brackets;
      continue;
    }
    if (brackets) continue;
    if (c == ',' || c == ';') {
      next();
      continue;
    }
    if (c == '=' || c == '@') inName = false;
    if (inName && c != ' ' && c != '\t' && c != '\n') name += c;
  }
  next();
  return names;
}

std::string refusedFilter(const std::string& graph) {
  const std::vector<std::string> names = filterNames(graph);
  for (size_t i = 0; i < names.size(); ++i) {
    const bool allowed = i == 0 ? listed(std::begin(generators), std::end(generators), names[i])
                                : listed(std::begin(pictureFilters), std::end(pictureFilters), names[i]);
    if (!allowed) return names[i].empty() ? std::string("(no name)") : names[i];
  }
  return "";
}

}  // namespace platform::testcamera
