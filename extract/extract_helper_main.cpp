// fileindex-extract [PATH]: extracts the content fields of files.
//
// Without PATH it serves the indexer: a request on standard input is a path ended by a NUL byte,
// its reply one line on standard output, {"fields": {...}} or {"error": "reason"}; it exits 0 at
// the end of its input. With PATH it prints the fields of that one file as a JSON object (exit
// status 1 with one line on standard error when the file cannot be extracted; 2 for a usage
// error).
//
// Runs under its own limits (memory, no file writes but its in-memory copies of archive members,
// few descriptors, no core dump, and CPU time for each file) and confined to reading files and
// writing its replies (syscall_filter.hpp), so a hostile file costs at most this one process.
// The limit on file writes covers its output too: read it through a pipe or a socket, never
// redirect it to a file.
#include <fcntl.h>
#include <sys/resource.h>
#include <unistd.h>

#include <cerrno>
#include <climits>
#include <clocale>
#include <cstdio>
#include <cstring>
#include <exception>
#include <iostream>
#include <string>

#include "common/json_util.hpp"
#include "extract/content.hpp"
#include "extract/syscall_filter.hpp"

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

constexpr rlim_t kCpuSecondsPerFile = 30;
[[maybe_unused]] constexpr rlim_t kMemoryBytes = rlim_t{1} << 30;

void Limit(int resource, rlim_t value, rlim_t hard) {
  struct rlimit lim = {value, hard};
  setrlimit(resource, &lim);
}

void Limit(int resource, rlim_t value) { Limit(resource, value, value); }

// The CPU limit counts the whole life of the process, so before each file its soft limit is
// moved to what has been used so far (rounded up) plus one file's allowance. Overrunning it
// raises SIGXCPU, which ends the process.
void LimitCpuForOneFile() {
  struct rusage usage;
  struct rlimit lim;
  if (getrusage(RUSAGE_SELF, &usage) != 0 || getrlimit(RLIMIT_CPU, &lim) != 0) return;
  const rlim_t used = static_cast<rlim_t>(usage.ru_utime.tv_sec + usage.ru_stime.tv_sec) + 1;
  lim.rlim_cur = used + kCpuSecondsPerFile;
  if (lim.rlim_max != RLIM_INFINITY && lim.rlim_cur > lim.rlim_max) lim.rlim_cur = lim.rlim_max;
  setrlimit(RLIMIT_CPU, &lim);
}

bool WriteAll(int fd, const std::string& text) {
  size_t done = 0;
  while (done < text.size()) {
    const ssize_t n = write(fd, text.data() + done, text.size() - done);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) return false;
    done += static_cast<size_t>(n);
  }
  return true;
}

// Everything the helper opens before it reads files is open by now; a helper that cannot be
// confined reads nothing.
bool Confine() {
  std::string error;
  if (orvane::extract::ConfineExtractionHelper(&error)) return true;
  std::fprintf(stderr, "%s\n", error.c_str());
  return false;
}

// The fields of one file as a reply object.
Json::Value Reply(const std::string& path) {
  Json::Value reply(Json::objectValue);
  std::string error;
  try {
    LimitCpuForOneFile();
    reply["fields"] = orvane::extract::ExtractContent(path);
    return reply;
  } catch (const std::exception& e) {
    error = e.what();
  } catch (...) {
  }
  reply["error"] = error.empty() ? "extraction failed" : error;
  return reply;
}

// Answers the requests on `in` until its end.
int Serve(int in, int out) {
  std::string pending;
  char chunk[4096];
  for (;;) {
    size_t end;
    while ((end = pending.find('\0')) == std::string::npos) {
      if (pending.size() > PATH_MAX) {
        std::fprintf(stderr, "request longer than a path can be\n");
        return 2;
      }
      const ssize_t n = read(in, chunk, sizeof(chunk));
      if (n < 0 && errno == EINTR) continue;
      if (n < 0) {
        std::fprintf(stderr, "cannot read requests: %s\n", std::strerror(errno));
        return 1;
      }
      if (n == 0) {
        if (pending.empty()) return 0;
        std::fprintf(stderr, "request cut short\n");
        return 2;
      }
      pending.append(chunk, static_cast<size_t>(n));
    }
    const std::string path = pending.substr(0, end);
    pending.erase(0, end + 1);
    if (!WriteAll(out, orvane::JsonToString(Reply(path)) + "\n")) return 1;
  }
}

}  // namespace

int main(int argc, char** argv) {
  if (argc > 2) {
    std::fprintf(stderr, "usage: fileindex-extract [PATH]\n");
    return 2;
  }
  std::setlocale(LC_ALL, "C.UTF-8");
  // No file may be written; the hard limit leaves room to fill one archive member's in-memory
  // file, for which the soft limit is raised only while that is done.
  Limit(RLIMIT_FSIZE, 0, orvane::extract::kMaxMemberBytes);
  Limit(RLIMIT_CORE, 0);
  Limit(RLIMIT_NOFILE, 64);
#if !ORVANE_ASAN
  // The address sanitizer reserves terabytes of address space, so this limit is left out of
  // sanitizer builds.
  Limit(RLIMIT_AS, kMemoryBytes);
#endif
  if (argc == 2) {
    if (!Confine()) return 1;
    const Json::Value reply = Reply(argv[1]);
    if (reply.isMember("error")) {
      std::fprintf(stderr, "%s\n", reply["error"].asCString());
      return 1;
    }
    std::cout << orvane::JsonToString(reply["fields"]) << std::endl;
    return 0;
  }
  // Requests and replies move to descriptors of their own, so that whatever a format library
  // prints on standard output goes to standard error instead of into a reply, and nothing it
  // reads from standard input is taken from a request.
  const int in = fcntl(0, F_DUPFD_CLOEXEC, 3);
  const int out = fcntl(1, F_DUPFD_CLOEXEC, 3);
  const int null = open("/dev/null", O_RDONLY | O_CLOEXEC);
  if (in < 0 || out < 0 || null < 0 || dup2(null, 0) < 0 || dup2(2, 1) < 0) {
    std::fprintf(stderr, "cannot set up descriptors: %s\n", std::strerror(errno));
    return 1;
  }
  close(null);
  if (!Confine()) return 1;
  return Serve(in, out);
}
