// searchgw: the HTTP search gateway for Samba's Spotlight service. Listens on 127.0.0.1 (port
// 9210) until SIGTERM or SIGINT and answers `_search` requests from the search engine's
// indexes; see README.md.
#include <syslog.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <iostream>
#include <string>

#include "common/error.hpp"
#include "common/log.hpp"
#include "common/root.hpp"
#include "common/wire.hpp"
#include "daemons/searchgw/gateway.hpp"
#include "platform/daemon_start.hpp"

namespace {

const char kUsage[] =
    "usage: searchgw [--foreground] [--address IP] [--port N] [--engine-socket PATH]\n"
    "                [--pid-file PATH] [--threads N] [--max-connections N]\n"
    "                [--max-connections-per-user N] [--idle-timeout-ms N]\n"
    "                [--request-timeout-ms N]\n";

struct Flags {
  bool foreground = false;
  std::string engine_socket = orvane::kElasticdSearchSockPath;
  std::string pid_file = "/var/run/searchgw.pid";
  orvane::searchgw::GatewayOptions gateway;
};

bool ParseNumber(const char* text, long long min, long long max, long long* out) {
  char* end = nullptr;
  errno = 0;
  const long long v = std::strtoll(text, &end, 10);
  if (errno != 0 || end == text || *end != '\0' || v < min || v > max) return false;
  *out = v;
  return true;
}

bool ParseFlags(int argc, char** argv, Flags* f) {
  orvane::searchgw::GatewayOptions& g = f->gateway;
  for (int i = 1; i < argc; ++i) {
    const std::string arg = argv[i];
    const char* next = i + 1 < argc ? argv[i + 1] : nullptr;
    auto text = [&](std::string* out) {
      if (next == nullptr) return false;
      *out = next;
      ++i;
      return true;
    };
    auto number = [&](long long min, long long max, auto* out) {
      long long v = 0;
      if (next == nullptr || !ParseNumber(next, min, max, &v)) return false;
      *out = static_cast<std::remove_pointer_t<decltype(out)>>(v);
      ++i;
      return true;
    };
    bool ok = true;
    if (arg == "--foreground")
      f->foreground = true;
    else if (arg == "--address")
      ok = text(&g.address);
    else if (arg == "--port")
      ok = number(0, 65535, &g.port);
    else if (arg == "--engine-socket")
      ok = text(&f->engine_socket);
    else if (arg == "--pid-file")
      ok = text(&f->pid_file);
    else if (arg == "--threads")
      ok = number(1, 64, &g.threads);
    else if (arg == "--max-connections")
      ok = number(1, 100000, &g.max_connections);
    else if (arg == "--max-connections-per-user")
      ok = number(1, 100000, &g.max_connections_per_user);
    else if (arg == "--idle-timeout-ms")
      ok = number(1, 86400000, &g.idle_timeout_ms);
    else if (arg == "--request-timeout-ms")
      ok = number(1, 600000, &g.request_timeout_ms);
    else
      ok = false;
    if (!ok) {
      std::cerr << "searchgw: bad or incomplete option " << arg << "\n" << kUsage;
      return false;
    }
  }
  return true;
}

}  // namespace

int main(int argc, char** argv) {
  Flags flags;
  if (!ParseFlags(argc, argv, &flags)) return 2;
  orvane::platform::BecomeDaemon("searchgw", flags.foreground);

  orvane::platform::DaemonSignals signals(false);
  flags.gateway.engine_socket = orvane::RootedPath(flags.engine_socket);
  try {
    const orvane::platform::PidFile pid_file(orvane::RootedPathForWrite(flags.pid_file));
    orvane::searchgw::Gateway gateway(flags.gateway);
    gateway.Start();
    ORVANE_LOG(LOG_INFO, "serving on %s port %u, pid %d", flags.gateway.address.c_str(),
               static_cast<unsigned>(gateway.port()), static_cast<int>(::getpid()));
    orvane::platform::NotifyReady();
    const int sig = signals.Wait();
    ORVANE_LOG(LOG_INFO, "stopping on signal %d", sig);
    gateway.Stop();
  } catch (const std::exception& e) {
    ORVANE_LOG(LOG_ERR, "cannot serve: %s", e.what());
    return 1;
  }
  ORVANE_LOG(LOG_INFO, "stopped");
  return 0;
}
