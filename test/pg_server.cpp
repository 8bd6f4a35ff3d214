#include "test/pg_server.hpp"

#include <fcntl.h>
#include <grp.h>
#include <libpq-fe.h>
#include <pwd.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <stdexcept>

namespace orvane {
namespace test {

namespace {
const char kPgBin[] = "/usr/lib/postgresql/15/bin/";
}  // namespace

PgServer::PgServer() {
  const passwd* pw = getpwnam("nobody");
  if (pw == nullptr) throw std::runtime_error("no user nobody");
  uid_ = pw->pw_uid;
  gid_ = pw->pw_gid;
  // The scratch folder is root's 0700: the cluster lives in a folder of nobody's below it.
  chmod(dir_.path().c_str(), 0755);
  home_ = dir_.Path("pg");
  mkdir(home_.c_str(), 0700);
  if (chown(home_.c_str(), uid_, gid_) != 0) throw std::runtime_error("chown " + home_);
  const int rc = Run({"initdb", "-D", home_ + "/data", "-A", "trust", "-U", "fileindex", "-E",
                      "UTF8", "--locale=C", "--no-sync"});
  if (rc != 0) throw std::runtime_error("initdb failed: " + ReadFile(home_ + "/log"));
  Start();
}

std::string PgServer::conninfo() const {
  return "host=" + home_ + " port=5432 dbname=postgres user=fileindex connect_timeout=5";
}

void PgServer::Stop(int sig) {
  if (pid_ <= 0) return;
  kill(pid_, sig);
  int status = 0;
  waitpid(pid_, &status, 0);
  pid_ = -1;
}

void PgServer::Start() {
  pid_ = fork();
  if (pid_ == 0) {
    BecomeServerUser();
    execl((std::string(kPgBin) + "postgres").c_str(), "postgres", "-D", (home_ + "/data").c_str(),
          "-k", home_.c_str(), "-c", "listen_addresses=", "-c", "shared_buffers=16MB",
          static_cast<char*>(nullptr));
    _exit(127);
  }
  const bool up = WaitFor([&] { return PQping(conninfo().c_str()) == PQPING_OK; }, 60000);
  if (!up) throw std::runtime_error("server did not start: " + ReadFile(home_ + "/log"));
}

int PgServer::Run(const std::vector<std::string>& argv) {
  const pid_t pid = fork();
  if (pid == 0) {
    BecomeServerUser();
    const std::string program = kPgBin + argv[0];
    std::vector<char*> args;
    args.push_back(const_cast<char*>(program.c_str()));
    for (size_t i = 1; i < argv.size(); ++i) args.push_back(const_cast<char*>(argv[i].c_str()));
    args.push_back(nullptr);
    execv(args[0], args.data());
    _exit(127);
  }
  int status = 0;
  waitpid(pid, &status, 0);
  return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
}

// In the child only: output to the server's log, then the server's user.
void PgServer::BecomeServerUser() {
  const int log = open((home_ + "/log").c_str(), O_WRONLY | O_CREAT | O_APPEND, 0600);
  if (log >= 0) {
    if (fchown(log, uid_, gid_) != 0) _exit(126);
    dup2(log, 1);
    dup2(log, 2);
  }
  if (setgroups(0, nullptr) != 0 || setgid(gid_) != 0 || setuid(uid_) != 0) _exit(126);
}

}  // namespace test
}  // namespace orvane
