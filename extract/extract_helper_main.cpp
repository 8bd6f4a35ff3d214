// fileindex-extract PATH: prints the content fields of one file as a JSON object.
//
// Runs under its own limits (CPU time, memory, no file writes, few descriptors, no core dump),
// so a hostile file costs at most this one process. Exit status 0 on success; 1 with one line
// on standard error when the file cannot be extracted; 2 for a usage error.
#include <sys/resource.h>

#include <clocale>
#include <cstdio>
#include <exception>
#include <iostream>

#include "common/json_util.hpp"
#include "extract/content.hpp"

#if defined(__SANITIZE_ADDRESS__)
#define ORVANE_ASAN 1
#elif defined(__has_feature)
#if __has_feature(address_sanitizer)
#define ORVANE_ASAN 1
#endif
#endif
#ifndef ORVANE_ASAN
#define ORVANE_ASAN 0
#endif

namespace {

constexpr rlim_t kCpuSeconds = 30;
[[maybe_unused]] constexpr rlim_t kMemoryBytes = rlim_t{1} << 30;

void Limit(int resource, rlim_t value) {
  struct rlimit lim = {value, value};
  setrlimit(resource, &lim);
}

}  // namespace

int main(int argc, char** argv) {
  if (argc != 2) {
    std::fprintf(stderr, "usage: fileindex-extract PATH\n");
    return 2;
  }
  std::setlocale(LC_ALL, "C.UTF-8");
  Limit(RLIMIT_CPU, kCpuSeconds);
  Limit(RLIMIT_FSIZE, 0);
  Limit(RLIMIT_CORE, 0);
  Limit(RLIMIT_NOFILE, 64);
#if !ORVANE_ASAN
  // The address sanitizer reserves terabytes of address space, so this limit is left out of
  // sanitizer builds.
  Limit(RLIMIT_AS, kMemoryBytes);
#endif
  try {
    std::cout << orvane::JsonToString(orvane::extract::ExtractContent(argv[1])) << std::endl;
  } catch (const std::exception& e) {
    std::fprintf(stderr, "%s\n", e.what());
    return 1;
  }
  return 0;
}
