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
#include "daemons/http/flags.hpp"
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

bool ParseFlags(int argc, char** argv, Flags* f) {
  orvane::searchgw::GatewayOptions& g = f->gateway;
  orvane::httpd::FlagArgs args(argc, argv);
  for (const char* option = args.Next(); option != nullptr; option = args.Next()) {
    const std::string arg = option;
    bool ok = true;
    if (arg == "--foreground")
      f->foreground = true;
    else if (arg == "--address")
      ok = args.Text(&g.address);
    else if (arg == "--port")
      ok = args.Number(0, 65535, &g.port);
    else if (arg == "--engine-socket")
      ok = args.Text(&f->engine_socket);
    else if (arg == "--pid-file")
      ok = args.Text(&f->pid_file);
    else if (arg == "--threads")
      ok = args.Number(1, 64, &g.threads);
    else if (arg == "--max-connections")
      ok = args.Number(1, 100000, &g.max_connections);
    else if (arg == "--max-connections-per-user")
      ok = args.Number(1, 100000, &g.max_connections_per_user);
    else if (arg == "--idle-timeout-ms")
      ok = args.Number(1, 86400000, &g.idle_timeout_ms);
    else if (arg == "--request-timeout-ms")
      ok = args.Number(1, 600000, &g.request_timeout_ms);
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
