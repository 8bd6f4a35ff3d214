// libFuzzer harness of the frame reader and the request dispatcher: each input is served on a
// fresh connection (a socket pair) by the daemon's own Server::Serve, against an engine whose
// indexes live in a scratch folder. The first byte chooses how the rest is sent: 0 as raw
// bytes (length prefix included), anything else as the payload of one well-formed frame, with
// bit 1 choosing the public socket's rights. Every reply must be one frame holding a JSON
// object with a boolean "success"; anything else aborts.
#include <ftw.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>

#include "common/json_util.hpp"
#include "common/log.hpp"
#include "daemons/quixelasticd/engine.hpp"
#include "daemons/quixelasticd/server.hpp"

namespace {

using orvane::elasticd::Engine;
using orvane::elasticd::EngineOptions;
using orvane::elasticd::Server;
using orvane::elasticd::ServerOptions;

std::string* g_scratch = nullptr;

struct Fixture {
  Fixture() {
    char tmpl[] = "/tmp/quixelasticd-fuzz-XXXXXX";
    if (mkdtemp(tmpl) == nullptr) std::abort();
    dir = tmpl;
    // The scratch folder goes when the fuzzer exits normally; a crash keeps it for a look.
    g_scratch = new std::string(dir);
    std::atexit([] {
      nftw(g_scratch->c_str(),
           [](const char* p, const struct stat*, int, struct FTW*) { return remove(p) == 0 ? 0 : 0; },
           64, FTW_DEPTH | FTW_PHYS);
    });
    orvane::SetLogSink([](int, const std::string&) {});
    EngineOptions options;
    options.registry_file = dir + "/state/indexes.json";
    options.running_marker = dir + "/state/running";
    options.index_root = dir;
    options.memory_limit_bytes = 256 << 20;
    engine = new Engine(options);
    engine->Start();
    engine->WaitOpened();
    ServerOptions server_options;
    server_options.max_frame_bytes = 1 << 20;
    server_options.io_timeout_micros = 200000;
    server = new Server(*engine, server_options);
    // One index with a few documents, so that document commands reach the store.
    orvane::JsonValue create;
    create.fromString(
        R"({"command":"index_create","data":{"id":"fileindex_s","path":")" + dir +
        R"(/db","mappings":{"property_id":"QUIXMDPath","properties":{"QUIXMDPath":{"analyzer":
        "keyword","required":true,"_all":false},"QUIXMDFSSize":{"type":"int"},
        "QUIXMDSearchFileName":{"type":"text","preprocess":["tolower","ngram"]},
        "QUIXMDSearchAncestor":{"type":"text","_all":false,"preprocess":["list_ancestor"]}}}}})");
    orvane::elasticd::Caller root;
    root.privileged = true;
    engine->HandleValue(create, root);
  }
  std::string dir;
  Engine* engine;  // never destroyed: the process ends with the fuzzer
  Server* server;
};

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  static Fixture* fixture = new Fixture();
  if (size == 0) return 0;
  const uint8_t mode = data[0];
  std::string bytes(reinterpret_cast<const char*>(data + 1), size - 1);
  if (mode != 0) {
    const uint32_t n = static_cast<uint32_t>(bytes.size());
    bytes.insert(0, std::string(reinterpret_cast<const char*>(&n), 4));
  }
  int fds[2];
  if (socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, fds) != 0) std::abort();
  const int big = 4 << 20;
  setsockopt(fds[0], SOL_SOCKET, SO_SNDBUF, &big, sizeof(big));
  setsockopt(fds[1], SOL_SOCKET, SO_SNDBUF, &big, sizeof(big));
  if (!bytes.empty() && write(fds[0], bytes.data(), bytes.size()) !=
                            static_cast<ssize_t>(bytes.size())) {
    std::abort();
  }
  shutdown(fds[0], SHUT_WR);
  fixture->server->Serve(fds[1], (mode & 2) != 0);
  close(fds[1]);
  std::string reply;
  char buf[65536];
  for (;;) {
    const ssize_t n = read(fds[0], buf, sizeof(buf));
    if (n <= 0) break;
    reply.append(buf, static_cast<size_t>(n));
  }
  close(fds[0]);
  if (reply.empty()) return 0;  // a closed connection is an acceptable answer
  uint32_t len = 0;
  if (reply.size() < 4) std::abort();
  std::memcpy(&len, reply.data(), 4);
  if (reply.size() != 4 + static_cast<size_t>(len) || len == 0 || reply.back() != '\0') {
    std::fprintf(stderr, "bad reply frame\n");
    std::abort();
  }
  orvane::JsonValue value;
  if (!value.fromString(reply.substr(4, len - 1)) || !value.isObject() ||
      !value["success"].isBool()) {
    std::fprintf(stderr, "bad reply: %s\n", reply.c_str() + 4);
    std::abort();
  }
  return 0;
}
