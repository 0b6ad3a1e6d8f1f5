// The add-on's start-up without Node: what initialize finds and starts, then the screen pump, as
// a host process would keep them running. Prints each source's descriptor; runs until ended.
#include <chrono>
#include <iostream>
#include <stdexcept>
#include <thread>

#include "capture/log.h"
#include "descriptor.h"
#include "discovery.h"

int main() {
  capture::SourceList& sources = *new capture::SourceList;  // sources run until the process ends
  try {
    capture::discoverSources(sources);
  } catch (const std::runtime_error& e) {
    std::cout << e.what() << std::endl;  // as initialize reports it
  }
  for (size_t i = 0; i < sources.size(); ++i) {
    std::cout << "source";
    for (const auto& [key, value] : capture::describeSource(static_cast<int32_t>(i), *sources[i])) {
      std::cout << ' ' << key << '=';
      if (const auto* number = std::get_if<int32_t>(&value))
        std::cout << *number;
      else
        std::cout << '"' << std::get<std::string>(value) << '"';
    }
    std::cout << std::endl;
  }
  std::cout << "discovery done" << std::endl;
  for (;;) {
    try {
      for (auto& source : sources)
        if (source->type() == capture::Screen) source->capture();
    } catch (const std::runtime_error& e) {
      capture::logWarning(e.what());
    }
    std::this_thread::sleep_for(std::chrono::milliseconds(5));
  }
}
