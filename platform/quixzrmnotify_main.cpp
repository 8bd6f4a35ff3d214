// The notifier program: records one notification given on its command line.
#include <cstdio>
#include <string>
#include <vector>

#include "common/error.hpp"
#include "common/log.hpp"
#include "platform/notifier.hpp"

int main(int argc, char** argv) {
  orvane::SetLogSink(orvane::SyslogSink(false));
  std::vector<std::string> args(argv + 1, argv + argc);
  try {
    return orvane::platform::AppendNotification(orvane::platform::ParseNotification(args)) ? 0 : 1;
  } catch (const orvane::Error& e) {
    fprintf(stderr, "quixzrmnotify: %s\n", e.what());
    fprintf(stderr,
            "usage: quixzrmnotify [-c app] [-b x] [-e x] recipients title message [args...]\n");
    return 2;
  }
}
