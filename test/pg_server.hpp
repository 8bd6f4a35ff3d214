// PgServer: a PostgreSQL server of the test's own: a cluster made by initdb in a scratch folder,
// run as `nobody` (the server refuses root) and reachable only on a Unix socket in that folder.
// Started by the constructor, stopped by its pid at scope end; not thread-safe.
#ifndef ORVANE_TEST_PG_SERVER_HPP_
#define ORVANE_TEST_PG_SERVER_HPP_

#include <signal.h>
#include <sys/types.h>

#include <string>
#include <vector>

#include "test/test_util.hpp"

namespace orvane {
namespace test {

class PgServer {
 public:
  // Throws std::runtime_error with the server's log when it cannot be made or started.
  PgServer();
  ~PgServer() { Stop(SIGINT); }
  PgServer(const PgServer&) = delete;
  PgServer& operator=(const PgServer&) = delete;

  // A libpq connection string for the cluster's `postgres` database as its superuser.
  std::string conninfo() const;
  // The folder holding the socket, for other clients (psql -h).
  const std::string& socket_dir() const { return home_; }

  // `sig`: SIGINT stops cleanly, SIGQUIT as a crash would (recovery at the next start).
  void Stop(int sig);
  // Starts the stopped server again and waits until it answers.
  void Start();
  // Runs a program of the server's installation (psql, pg_ctl, ...) as the server's user;
  // returns its exit status.
  int Run(const std::vector<std::string>& argv);

 private:
  void BecomeServerUser();

  TempDir dir_;
  std::string home_;
  uid_t uid_ = 0;
  gid_t gid_ = 0;
  pid_t pid_ = -1;
};

}  // namespace test
}  // namespace orvane

#endif  // ORVANE_TEST_PG_SERVER_HPP_
