// A thread that does nothing but sleep 5 ms at a time, as the audio capture loop does while its
// buffer is empty, and what that costs on this machine: the floor under any 5 ms polling loop.
//   sleeploop [SECONDS=5]
// Prints "<wake-ups> <CPU seconds> <wall seconds>". Build: g++ -O2 sleeploop.cc
#include <sys/resource.h>

#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <thread>

int main(int argc, char** argv) {
  const double seconds = argc > 1 ? std::atof(argv[1]) : 5.0;
  const auto start = std::chrono::steady_clock::now();
  const auto end = start + std::chrono::duration<double>(seconds);
  long wakeups = 0;
  while (std::chrono::steady_clock::now() < end) {
    std::this_thread::sleep_for(std::chrono::milliseconds(5));
    ++wakeups;
  }
  rusage usage{};
  getrusage(RUSAGE_SELF, &usage);
  const double cpu =
      usage.ru_utime.tv_sec + usage.ru_utime.tv_usec / 1e6 + usage.ru_stime.tv_sec + usage.ru_stime.tv_usec / 1e6;
  const double wall = std::chrono::duration<double>(std::chrono::steady_clock::now() - start).count();
  std::printf("%ld %.3f %.3f\n", wakeups, cpu, wall);
  return 0;
}
