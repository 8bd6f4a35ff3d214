#include "fileindex/notify.hpp"

#include <spawn.h>
#include <sys/wait.h>
#include <syslog.h>

#include <cerrno>
#include <cstring>
#include <string>
#include <vector>

#include "common/log.hpp"
#include "common/root.hpp"

extern char** environ;

namespace orvane {
namespace fileindex {
namespace {

constexpr char kNotifierPath[] = "/usr/quix/bin/quixzrmnotify";

// Runs the notifier with `args` and waits for it, so that no child is left unreaped.
void RunNotifier(const std::vector<std::string>& args) {
  const std::string program = RootedPath(kNotifierPath);
  std::vector<char*> argv;
  argv.push_back(const_cast<char*>(program.c_str()));
  for (const std::string& arg : args) argv.push_back(const_cast<char*>(arg.c_str()));
  argv.push_back(nullptr);

  const int saved_errno = errno;
  pid_t pid = -1;
  const int rc = posix_spawn(&pid, program.c_str(), nullptr, nullptr, argv.data(), environ);
  if (rc != 0) {
    Log(LOG_DEBUG, "%s:%d cannot run %s: %s", SourceName(__FILE__), __LINE__, program.c_str(),
        strerror(rc));
  } else {
    int status = 0;
    while (waitpid(pid, &status, 0) < 0 && errno == EINTR) {
    }
  }
  errno = saved_errno;
}

}  // namespace

void SendZRMNotify() {
  RunNotifier({"-c", "QUIX.Orvane.Application", "-b", "true", "-e", "false", "@administrators",
               "app:displayname", "error:index_no_space",
               "<a data-quix-app=\"QUIX.Orvane.Application\" data-quix-fn=\"preference\">",
               "</a>"});
}

void NotifyLackOfMemory() {
  RunNotifier({"-c", "QUIX.Orvane.Application", "@administrators", "app:displayname",
               "error:lack_of_memory"});
}

}  // namespace fileindex
}  // namespace orvane
