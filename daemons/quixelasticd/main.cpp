// quixelasticd: the search-engine daemon. Serves "/var/run/quixelasticd.sock" (under
// ORVANE_ROOT) until SIGTERM or SIGINT; see README.md for the commands and options.
#include <pwd.h>
#include <syslog.h>
#include <unistd.h>

#include <cstdlib>
#include <cstring>
#include <iostream>
#include <memory>
#include <stdexcept>
#include <string>

#include "common/env.hpp"
#include "common/error.hpp"
#include "common/log.hpp"
#include "common/root.hpp"
#include "common/wire.hpp"
#include "daemons/quixelasticd/engine.hpp"
#include "daemons/quixelasticd/pg_backend.hpp"
#include "daemons/quixelasticd/pg_util.hpp"
#include "daemons/quixelasticd/server.hpp"
#include "platform/daemon_start.hpp"

namespace {

using orvane::Log;
using orvane::SourceName;

const char kUsage[] =
    "usage: quixelasticd [--foreground] [--socket PATH] [--public-socket PATH|none]\n"
    "                    [--pid-file PATH] [--state-dir DIR] [--service-user NAME]\n"
    "                    [--max-frame-bytes N] [--memory-limit-mb N] [--max-write-backlog N]\n"
    "                    [--max-connections N] [--io-timeout-s N] [--index-root DIR]\n"
    "                    [--max-public-connections N] [--max-public-connections-per-user N]\n"
    "                    [--max-public-requests-per-user N] [--public-timeout-ms N]\n"
    "                    [--search-budget-ms N] [--postgres CONNINFO [--server-name NAME]]\n";

struct Flags {
  bool foreground = false;
  std::string socket = orvane::kElasticdSockPath;
  std::string public_socket = orvane::kElasticdSearchSockPath;
  std::string pid_file = "/var/run/quixelasticd.pid";
  std::string state_dir = "/var/lib/quixelasticd";
  std::string service_user = "fileindex";
  std::string index_root;
  long long max_frame = orvane::wire::kEngineMaxFrameBytes;
  long long memory_mb = 1024;
  long long backlog = 64;
  long long connections = 256;
  long long io_timeout_s = orvane::wire::kEngineIoTimeoutMicros / 1000000;
  long long public_connections = 128;
  long long public_per_user = 16;
  long long public_requests_per_user = 4;
  long long public_timeout_ms = orvane::wire::kEnginePublicRequestTimeoutMicros / 1000;
  long long search_budget_ms = 10000;
  // A libpq connection string: the indexes live in that database instead of SQLite files.
  std::string postgres;
  std::string server_name;  // this server's name in a shared database; the host name if empty
};

// Connection attempts, two seconds apart, before a daemon whose database is away gives up.
constexpr int kConnectAttempts = 30;

bool ParseNumber(const char* text, long long min, long long* out) {
  char* end = nullptr;
  errno = 0;
  const long long v = std::strtoll(text, &end, 10);
  if (errno != 0 || end == text || *end != '\0' || v < min) return false;
  *out = v;
  return true;
}

bool ParseFlags(int argc, char** argv, Flags* f) {
  for (int i = 1; i < argc; ++i) {
    const std::string arg = argv[i];
    const char* next = i + 1 < argc ? argv[i + 1] : nullptr;
    auto text = [&](std::string* out) {
      if (next == nullptr) return false;
      *out = next;
      ++i;
      return true;
    };
    auto number = [&](long long min, long long* out) {
      if (next == nullptr || !ParseNumber(next, min, out)) return false;
      ++i;
      return true;
    };
    bool ok = true;
    if (arg == "--foreground") f->foreground = true;
    else if (arg == "--socket") ok = text(&f->socket);
    else if (arg == "--public-socket") ok = text(&f->public_socket);
    else if (arg == "--pid-file") ok = text(&f->pid_file);
    else if (arg == "--state-dir") ok = text(&f->state_dir);
    else if (arg == "--index-root") ok = text(&f->index_root);
    else if (arg == "--service-user") ok = text(&f->service_user);
    else if (arg == "--max-frame-bytes") ok = number(16, &f->max_frame) && f->max_frame <= 0xFFFFFFFFLL;
    else if (arg == "--memory-limit-mb") ok = number(0, &f->memory_mb);
    else if (arg == "--max-write-backlog") ok = number(0, &f->backlog);
    else if (arg == "--max-connections") ok = number(1, &f->connections);
    else if (arg == "--io-timeout-s") ok = number(1, &f->io_timeout_s);
    else if (arg == "--max-public-connections") ok = number(1, &f->public_connections);
    else if (arg == "--max-public-connections-per-user") ok = number(1, &f->public_per_user);
    else if (arg == "--max-public-requests-per-user") ok = number(1, &f->public_requests_per_user);
    else if (arg == "--public-timeout-ms") ok = number(1, &f->public_timeout_ms);
    else if (arg == "--search-budget-ms") ok = number(0, &f->search_budget_ms);
    else if (arg == "--postgres") ok = text(&f->postgres) && !f->postgres.empty();
    else if (arg == "--server-name") ok = text(&f->server_name) && !f->server_name.empty();
    else ok = false;
    if (!ok) {
      std::cerr << "quixelasticd: bad or incomplete option " << arg << "\n" << kUsage;
      return false;
    }
  }
  return true;
}


// The engine's and the server's options from the flags (paths under ORVANE_ROOT).
void ToOptions(const Flags& flags, orvane::elasticd::EngineOptions* engine_options,
               orvane::elasticd::ServerOptions* server_options) {
  const std::string state_dir = orvane::RootedPath(flags.state_dir);
  engine_options->registry_file = state_dir + "/indexes.json";
  engine_options->running_marker = state_dir + "/running";
  engine_options->memory_limit_bytes = flags.memory_mb << 20;
  engine_options->max_write_backlog = static_cast<int>(flags.backlog);
  engine_options->index_root = flags.index_root;
  engine_options->search_budget_micros = flags.search_budget_ms * 1000;
  server_options->socket_path = orvane::RootedPath(flags.socket);
  if (flags.public_socket != "none") {
    server_options->public_socket_path = orvane::RootedPath(flags.public_socket);
  }
  server_options->max_frame_bytes = static_cast<uint32_t>(flags.max_frame);
  server_options->max_connections = static_cast<int>(flags.connections);
  server_options->io_timeout_micros = flags.io_timeout_s * 1000000LL;
  server_options->max_public_connections = static_cast<int>(flags.public_connections);
  server_options->max_public_connections_per_user = static_cast<int>(flags.public_per_user);
  server_options->max_public_requests_per_user = static_cast<int>(flags.public_requests_per_user);
  server_options->public_request_timeout_micros = flags.public_timeout_ms * 1000;
  if (struct passwd* pw = ::getpwnam(flags.service_user.c_str())) {
    server_options->service_uid = pw->pw_uid;
    server_options->service_gid = pw->pw_gid;
  } else {
    ORVANE_LOG(LOG_WARNING, "service account %s not found: only root may change indexes",
               flags.service_user.c_str());
  }
}

// The shared database's stores. A database that is starting too (the whole machine booting)
// is waited for a while before the daemon gives up and its service manager starts it again.
std::shared_ptr<orvane::elasticd::StoreBackend> ConnectPostgres(const Flags& flags) {
  std::string server = flags.server_name;
  if (server.empty()) {
    char host[256] = {};
    if (::gethostname(host, sizeof(host) - 1) != 0 || host[0] == '\0') {
      throw std::runtime_error("no host name to name this server by; give --server-name");
    }
    server = host;
  }
  for (int attempt = 1;; ++attempt) {
    try {
      return orvane::elasticd::PgBackend(flags.postgres, server);
    } catch (const orvane::elasticd::StoreUnavailableError& e) {
      if (attempt == kConnectAttempts) throw;
      ORVANE_LOG(LOG_WARNING, "the database is not reachable yet (%s); trying again", e.what());
      orvane::Env::Current()->SleepMicros(2 * 1000000LL);
    }
  }
}

// Serves until a stop signal; 1 when the engine or the server could not start.
int Serve(const Flags& flags, orvane::platform::DaemonSignals* signals) {
  orvane::elasticd::EngineOptions engine_options;
  orvane::elasticd::ServerOptions server_options;
  ToOptions(flags, &engine_options, &server_options);
  if (!flags.postgres.empty()) {
    try {
      engine_options.stores = ConnectPostgres(flags);
    } catch (const std::exception& e) {
      ORVANE_LOG(LOG_ERR, "cannot start: the index database: %s", e.what());
      return 1;
    }
  }
  int status = 0;
  orvane::elasticd::Engine engine(engine_options);
  orvane::elasticd::Server server(engine, server_options);
  try {
    engine.Start();
    server.Start();
  } catch (const std::exception& e) {
    ORVANE_LOG(LOG_ERR, "cannot start: %s", e.what());
    status = 1;
  }
  if (status == 0) {
    ORVANE_LOG(LOG_INFO, "started, pid %d", static_cast<int>(::getpid()));
    orvane::platform::NotifyReady();
    const int sig = signals->Wait();
    ORVANE_LOG(LOG_INFO, "stopping on signal %d", sig);
  }
  // Connections in flight finish first; then every index is synced and closed.
  server.Stop();
  engine.Shutdown();
  return status;
}

}  // namespace

int main(int argc, char** argv) {
  Flags flags;
  if (!ParseFlags(argc, argv, &flags)) return 2;
  orvane::platform::BecomeDaemon("quixelasticd", flags.foreground);

  // Before any thread starts, so that every one of them leaves the signals to the main thread.
  orvane::platform::DaemonSignals signals(false);
  int status = 0;
  try {
    const orvane::platform::PidFile pid_file(orvane::RootedPathForWrite(flags.pid_file));
    status = Serve(flags, &signals);
  } catch (const orvane::Error& e) {
    ORVANE_LOG(LOG_ERR, "%s", e.what());
    return 1;
  }
  ORVANE_LOG(LOG_INFO, "stopped");
  return status;
}
