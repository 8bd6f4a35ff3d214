// webd: the web page for searching the index and administering it. Listens on 127.0.0.1 (port
// 9280) until SIGTERM or SIGINT; see README.md.
#include <syslog.h>
#include <unistd.h>

#include <boost/asio/ip/address.hpp>
#include <cerrno>
#include <cstdlib>
#include <iostream>
#include <string>

#include "common/error.hpp"
#include "common/log.hpp"
#include "common/root.hpp"
#include "common/wire.hpp"
#include "daemons/http/flags.hpp"
#include "daemons/http/server.hpp"
#include "daemons/webd/web_app.hpp"
#include "platform/daemon_start.hpp"

namespace {

const char kUsage[] =
    "usage: webd [--foreground] [--address IP] [--port N] [--tls-certificate PEM]\n"
    "            [--plain-http-beyond-loopback] [--www DIR] [--pam-service NAME]\n"
    "            [--pam-dir DIR] [--engine-socket PATH] [--pid-file PATH] [--threads N]\n"
    "            [--max-connections N] [--max-connections-per-user N]\n"
    "            [--session-idle-minutes N] [--session-hours N]\n";

struct Flags {
  bool foreground = false;
  bool plain_beyond_loopback = false;
  std::string engine_socket = orvane::kElasticdSearchSockPath;
  std::string pid_file = "/var/run/webd.pid";
  orvane::httpd::ServerOptions server;
  orvane::webd::WebOptions web;
};

bool ParseFlags(int argc, char** argv, Flags* f) {
  orvane::httpd::ServerOptions& s = f->server;
  orvane::httpd::FlagArgs args(argc, argv);
  for (const char* option = args.Next(); option != nullptr; option = args.Next()) {
    const std::string arg = option;
    bool ok = true;
    long long minutes = 0;
    if (arg == "--foreground") {
      f->foreground = true;
    } else if (arg == "--plain-http-beyond-loopback") {
      f->plain_beyond_loopback = true;
    } else if (arg == "--address") {
      ok = args.Text(&s.address);
    } else if (arg == "--port") {
      ok = args.Number(0, 65535, &s.port);
    } else if (arg == "--tls-certificate") {
      ok = args.Text(&s.tls_certificate);
    } else if (arg == "--www") {
      ok = args.Text(&f->web.www_dir);
    } else if (arg == "--pam-service") {
      ok = args.Text(&f->web.pam.name);
    } else if (arg == "--pam-dir") {
      ok = args.Text(&f->web.pam.dir);
    } else if (arg == "--engine-socket") {
      ok = args.Text(&f->engine_socket);
    } else if (arg == "--pid-file") {
      ok = args.Text(&f->pid_file);
    } else if (arg == "--threads") {
      ok = args.Number(1, 64, &s.threads);
    } else if (arg == "--max-connections") {
      ok = args.Number(1, 100000, &s.max_connections);
    } else if (arg == "--max-connections-per-user") {
      ok = args.Number(1, 100000, &s.max_connections_per_user);
    } else if (arg == "--session-idle-minutes") {
      ok = args.Number(1, 7 * 24 * 60, &minutes);
      f->web.session_idle_seconds = minutes * 60;
    } else if (arg == "--session-hours") {
      ok = args.Number(1, 24 * 365, &minutes);
      f->web.session_life_seconds = minutes * 3600;
    } else {
      ok = false;
    }
    if (!ok) {
      std::cerr << "webd: bad or incomplete option " << arg << "\n" << kUsage;
      return false;
    }
  }
  return true;
}

}  // namespace

int main(int argc, char** argv) {
  Flags flags;
  flags.server.port = 9280;
  flags.server.idle_timeout_ms = 60 * 1000;  // browsers open again at once
  flags.server.threads = 8;
  flags.web.www_dir = WEBD_WWW_DIR;
  if (!ParseFlags(argc, argv, &flags)) return 2;
  boost::system::error_code ec;
  const auto address = boost::asio::ip::make_address(flags.server.address, ec);
  if (!ec && !address.is_loopback() && flags.server.tls_certificate.empty() &&
      !flags.plain_beyond_loopback) {
    std::cerr << "webd: " << flags.server.address
              << " is not a loopback address: passwords would cross the network in clear. Give "
                 "--tls-certificate PEM, or --plain-http-beyond-loopback when a proxy in front "
                 "encrypts\n";
    return 2;
  }
  orvane::platform::BecomeDaemon("webd", flags.foreground);

  orvane::platform::DaemonSignals signals(false);
  flags.web.engine_socket = orvane::RootedPath(flags.engine_socket);
  flags.web.indexer_socket = orvane::RootedPath(orvane::kFileIndexdSockPath);
  flags.web.secure_cookie = !flags.server.tls_certificate.empty();
  try {
    const orvane::platform::PidFile pid_file(orvane::RootedPathForWrite(flags.pid_file));
    orvane::webd::WebApp app(flags.web);
    orvane::httpd::Server server(
        flags.server,
        orvane::httpd::Handlers{
            [&app](const orvane::httpd::Request& req, const orvane::httpd::Peer& peer) {
              return app.Handle(req, peer);
            },
            orvane::webd::WebApp::Refused});
    server.Start();
    ORVANE_LOG(LOG_INFO, "serving %s://%s:%u/, pid %d",
               flags.server.tls_certificate.empty() ? "http" : "https",
               flags.server.address.c_str(), static_cast<unsigned>(server.port()),
               static_cast<int>(::getpid()));
    orvane::platform::NotifyReady();
    const int sig = signals.Wait();
    ORVANE_LOG(LOG_INFO, "stopping on signal %d", sig);
    server.Stop();
  } catch (const std::exception& e) {
    ORVANE_LOG(LOG_ERR, "cannot serve: %s", e.what());
    return 1;
  }
  ORVANE_LOG(LOG_INFO, "stopped");
  return 0;
}
