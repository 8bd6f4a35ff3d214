// webd: the web page for searching the index and administering it. Listens on 127.0.0.1 (port
// 9280) until SIGTERM or SIGINT; see README.md.
#include <syslog.h>
#include <unistd.h>

#include <boost/asio/ip/address.hpp>
#include <cerrno>
#include <cstdlib>
#include <iostream>
#include <string>
#include <type_traits>

#include "common/error.hpp"
#include "common/log.hpp"
#include "common/root.hpp"
#include "common/wire.hpp"
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

bool ParseNumber(const char* text, long long min, long long max, long long* out) {
  char* end = nullptr;
  errno = 0;
  const long long v = std::strtoll(text, &end, 10);
  if (errno != 0 || end == text || *end != '\0' || v < min || v > max) return false;
  *out = v;
  return true;
}

bool ParseFlags(int argc, char** argv, Flags* f) {
  orvane::httpd::ServerOptions& s = f->server;
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
    long long minutes = 0;
    if (arg == "--foreground") {
      f->foreground = true;
    } else if (arg == "--plain-http-beyond-loopback") {
      f->plain_beyond_loopback = true;
    } else if (arg == "--address") {
      ok = text(&s.address);
    } else if (arg == "--port") {
      ok = number(0, 65535, &s.port);
    } else if (arg == "--tls-certificate") {
      ok = text(&s.tls_certificate);
    } else if (arg == "--www") {
      ok = text(&f->web.www_dir);
    } else if (arg == "--pam-service") {
      ok = text(&f->web.pam.name);
    } else if (arg == "--pam-dir") {
      ok = text(&f->web.pam.dir);
    } else if (arg == "--engine-socket") {
      ok = text(&f->engine_socket);
    } else if (arg == "--pid-file") {
      ok = text(&f->pid_file);
    } else if (arg == "--threads") {
      ok = number(1, 64, &s.threads);
    } else if (arg == "--max-connections") {
      ok = number(1, 100000, &s.max_connections);
    } else if (arg == "--max-connections-per-user") {
      ok = number(1, 100000, &s.max_connections_per_user);
    } else if (arg == "--session-idle-minutes") {
      ok = number(1, 7 * 24 * 60, &minutes);
      f->web.session_idle_seconds = minutes * 60;
    } else if (arg == "--session-hours") {
      ok = number(1, 24 * 365, &minutes);
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
