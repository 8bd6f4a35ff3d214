#include "test/daemon_system.hpp"

#include <fcntl.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <cstring>
#include <fstream>
#include <thread>

#include "common/comm.hpp"
#include "common/json_util.hpp"
#include "common/root.hpp"
#include "common/util.hpp"
#include "common/wire.hpp"
#include "daemons/fileindexd/index_daemon.hpp"
#include "daemons/fileindexd/indexer.hpp"

namespace orvane {
namespace fileindexd {
namespace test {

System::System(const std::vector<std::string>& shares) : scoped_root_(root_.path()) {
  std::string list;
  for (const auto& share : shares) {
    MakeParentDirs(Vol(share + "/x"));
    if (!list.empty()) list += ",";
    list += R"({"name": ")" + share + R"(", "path": ")" + Vol(share) + R"(", "recycle_bin": true})";
  }
  orvane::test::WritePlatformConfig(root(), R"({"shares": [)" + list + "]}");
}

std::string System::Queue(const std::string& share) const {
  return Vol(share + "/@eaDir/@fileindex/queue");
}

void System::WriteFolders(const Json::Value& folders) const {
  JsonValue value(folders);
  MakeParentDirs(RootedPath("/var/packages/Orvane/etc/fileindex.folders"));
  value.toFile(RootedPath("/var/packages/Orvane/etc/fileindex.folders"));
}

void System::WriteFolders(std::initializer_list<Json::Value> folders) const {
  Json::Value list(Json::arrayValue);
  for (const Json::Value& f : folders) list.append(f);
  WriteFolders(list);
}

Json::Value System::Folder(const std::string& share_path, bool meta) {
  Json::Value f(Json::objectValue);
  f["path"] = share_path;
  f["name"] = Basename(share_path);
  for (const char* kind : {"document", "audio", "video", "photo"}) f[kind] = meta;
  return f;
}

std::unique_ptr<ChildProcess> System::StartEngine(const std::vector<std::string>& options) const {
  std::vector<std::string> argv = {QUIXELASTICD_BIN, "--foreground"};
  argv.insert(argv.end(), options.begin(), options.end());
  auto p = std::make_unique<ChildProcess>(root(), argv);
  WaitFor(
      [] {
        try {
          Engine("index_list", Json::Value(Json::objectValue));
          return true;
        } catch (const std::exception&) {
          return false;
        }
      },
      20000);
  return p;
}

std::unique_ptr<ChildProcess> System::StartNotifyd() const {
  return std::make_unique<ChildProcess>(root(), std::vector<std::string>{QUIXNOTIFYD_BIN});
}

std::unique_ptr<ChildProcess> System::StartIndexd() const {
  auto p = std::make_unique<ChildProcess>(root(), std::vector<std::string>{FILEINDEXD_BIN});
  WaitFor([] { return Command("status", Json::Value()).isObject(); }, 20000);
  return p;
}

std::set<std::string> System::Documents(const std::string& share) const {
  const auto docs = Indexer::ListDocuments(share, Vol(share));
  return std::set<std::string>(docs.begin(), docs.end());
}

Json::Value System::Engine(const std::string& command, const Json::Value& data) {
  Json::Value req(Json::objectValue);
  req["command"] = command;
  req["data"] = data;
  Json::Value res;
  SendRequestImpl(res, req);
  return res;
}

std::string RawCommand(const std::string& bytes) {
  UniqueFd fd = wire::Connect(RootedPath(kFileIndexdSockPath), 0);
  wire::Deadline never = wire::Deadline::Never();
  std::string reply;
  if (fd.valid() &&
      wire::WriteExact(fd.get(), bytes.data(), bytes.size(), never) == wire::IoStatus::kOk) {
    wire::ReadFrame(fd.get(), wire::kMaxDaemonReplyBytes, &reply, never);
  }
  return reply;
}

Json::Value Command(const std::string& type, const Json::Value& data) {
  Json::Value cmd(Json::objectValue);
  cmd["type"] = type;
  cmd["data"] = data;
  const std::string reply = RawCommand(wire::EncodeFrame(JsonToString(cmd) + '\0'));
  const std::string_view text = wire::PayloadText(reply);
  JsonValue value;
  if (text.empty() || !value.fromString(text.data(), text.data() + text.size())) {
    return Json::Value();
  }
  return std::move(value);
}

}  // namespace test
}  // namespace fileindexd
}  // namespace orvane
