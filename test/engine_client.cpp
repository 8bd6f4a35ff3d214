#include "test/engine_client.hpp"

#include <grp.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstring>

#include <gtest/gtest.h>

#include "common/fd.hpp"
#include "common/json_util.hpp"
#include "common/wire.hpp"

namespace orvane {
namespace elasticd {
namespace tc {

std::string Frame(const std::string& payload) { return wire::EncodeFrame(payload); }

std::string RawExchange(const std::string& socket, const std::string& bytes) {
  UniqueFd fd = wire::Connect(socket, 0);
  if (!fd.valid()) return "<connect failed>";
  wire::Deadline never = wire::Deadline::Never();
  // A daemon that stops reading early still answers or closes: that is what the tests check.
  wire::WriteExact(fd.get(), bytes.data(), bytes.size(), never);
  ::shutdown(fd.get(), SHUT_WR);
  std::string reply;
  wire::ReadFrame(fd.get(), UINT32_MAX, &reply, never);
  // Returns once the daemon has closed, so that its connection is over when the test goes on.
  char buf[4096];
  while (::recv(fd.get(), buf, sizeof(buf), 0) > 0) {
  }
  return reply;
}

Json::Value Request(const std::string& socket, const Json::Value& request) {
  const std::string payload = RawExchange(socket, Frame(JsonToString(request) + '\0'));
  const std::string_view text = wire::PayloadText(payload);
  JsonValue reply;
  if (!reply.fromString(text.data(), text.data() + text.size())) return Json::Value();
  return reply;
}

Json::Value RequestAs(const std::string& socket, const Json::Value& request, uid_t uid, gid_t gid) {
  int pipe_fds[2];
  if (::pipe(pipe_fds) != 0) return Json::Value();
  const pid_t pid = ::fork();
  if (pid == 0) {
    ::close(pipe_fds[0]);
    if (::setgroups(0, nullptr) != 0 || ::setgid(gid) != 0 || ::setuid(uid) != 0) _exit(3);
    const std::string text = JsonToString(Request(socket, request));
    if (::write(pipe_fds[1], text.data(), text.size()) < 0) _exit(4);
    _exit(0);
  }
  ::close(pipe_fds[1]);
  std::string text;
  char buf[4096];
  for (;;) {
    const ssize_t n = ::read(pipe_fds[0], buf, sizeof(buf));
    if (n <= 0) break;
    text.append(buf, static_cast<size_t>(n));
  }
  ::close(pipe_fds[0]);
  int status = 0;
  ::waitpid(pid, &status, 0);
  JsonValue reply;
  if (!reply.fromString(text)) return Json::Value();
  return reply;
}

DaemonProcess::DaemonProcess(const std::string& root, std::vector<std::string> extra_args)
    : root_(root), process_(root, Argv(std::move(extra_args))) {}

std::vector<std::string> DaemonProcess::Argv(std::vector<std::string> extra_args) {
  std::vector<std::string> args = {QUIXELASTICD_BINARY, "--foreground", "--service-user",
                                   "nobody-such-account"};
  args.insert(args.end(), extra_args.begin(), extra_args.end());
  return args;
}

bool DaemonProcess::WaitReady() {
  return Eventually([this] {
    const Json::Value r = Request(socket(), Cmd("index_list", Json::Value(Json::objectValue)));
    return r.isObject() && r["success"].asBool();
  });
}

Json::Value Cmd(const std::string& command, const Json::Value& data) {
  Json::Value r;
  r["command"] = command;
  r["data"] = data;
  return r;
}

Json::Value OnIndex(const std::string& command, const std::string& id) {
  Json::Value data;
  data["id"] = id;
  return Cmd(command, data);
}

Json::Value Parse(const std::string& text) {
  JsonValue v;
  EXPECT_TRUE(v.fromString(text)) << text;
  return v;
}

Json::Value Compound(const std::vector<Json::Value>& requests) {
  Json::Value c;
  c["compound"] = Json::Value(Json::arrayValue);
  for (const Json::Value& r : requests) c["compound"].append(r);
  return c;
}

Json::Value FileDoc(const std::string& path, int64_t size, int64_t mtime) {
  const size_t slash = path.find_last_of('/');
  const std::string name = path.substr(slash + 1);
  const size_t dot = name.find_last_of('.');
  Json::Value d;
  d["QUIXMDPath"] = path;
  d["QUIXMDFSName"] = name;
  d["QUIXMDParent"] = path.substr(0, slash);
  d["QUIXMDSearchFileName"] = name;
  d["QUIXMDSearchAncestor"] = path.substr(0, slash);
  d["QUIXMDExtension"] = dot == std::string::npos ? "" : name.substr(dot + 1);
  d["QUIXMDFSSize"] = static_cast<Json::Int64>(size);
  d["QUIXMDFSContentChangeDate"] = static_cast<Json::Int64>(mtime);
  return d;
}

Json::Value Upsert(const std::string& path, const std::string& id, int64_t size, int64_t mtime) {
  Json::Value data;
  data["id"] = id;
  data["doc_id"] = path;
  data["data"] = FileDoc(path, size, mtime);
  return Cmd("document_upsert_by_id", data);
}

Json::Value FileMappings() {
  JsonValue m;
  m.fromString(R"({
    "property_id": "QUIXMDPath",
    "default": {"type": "string", "analyzer": "quixstandard", "required": false, "stored": true,
                "_all": true},
    "properties": {
      "QUIXMDPath": {"analyzer": "keyword", "required": true, "_all": false},
      "QUIXMDFSName": {"analyzer": "keyword", "_all": false},
      "QUIXMDIsDir": {"type": "bool", "_all": false},
      "QUIXMDFSSize": {"type": "int"},
      "QUIXMDFSContentChangeDate": {"type": "int"},
      "QUIXMDTitle": {"type": "text"},
      "QUIXMDParent": {"analyzer": "keyword", "_all": false},
      "QUIXMDExtension": {"analyzer": "keyword", "_all": false},
      "QUIXMDTextContent": {"type": "text"},
      "QUIXMDSearchFileName": {"type": "text", "analyzer": "white space",
                               "preprocess": ["tolower", "ngram"]},
      "QUIXMDSearchAncestor": {"type": "text", "analyzer": "white space escaped", "_all": false,
                               "preprocess": ["list_ancestor"]},
      "QUIXMDSecret": {"stored": false}
    }
  })");
  return m;
}

}  // namespace tc
}  // namespace elasticd
}  // namespace orvane
