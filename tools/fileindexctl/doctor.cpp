#include "tools/fileindexctl/doctor.hpp"

#include <dirent.h>
#include <sys/stat.h>
#include <sys/statvfs.h>

#include <cerrno>
#include <cstring>
#include <fstream>
#include <iomanip>
#include <memory>
#include <set>
#include <string>
#include <vector>

#include "common/env.hpp"
#include "common/error.hpp"
#include "common/json_util.hpp"
#include "common/root.hpp"
#include "common/wire.hpp"
#include "fileindex/util.hpp"
#include "platform/config.hpp"
#include "platform/fault.hpp"
#include "platform/quota.hpp"
#include "tools/fileindexctl/cli.hpp"
#include "tools/fileindexctl/commands.hpp"

namespace orvane {
namespace ctl {
namespace {

// What the indexer itself refuses to index below (SDKShare::IsSpaceEnough).
constexpr uint64_t kLowSpaceBytes = 100ull << 20;
// Changes left waiting this long by an idle worker mean the index has stopped following.
constexpr int64_t kStaleSeconds = 3600;
constexpr char kStateDir[] = "/var/packages/Orvane/etc";

class Doctor {
 public:
  Json::Value Run() {
    CheckConfig();
    CheckDaemons();
    Json::Value status;
    try {
      status = StatusReport();
    } catch (const Error& e) {
      Add("folders", "problem", "the indexed folders cannot be read: " + ReasonOf(e.message),
          "fix what the message names; fileindexctl status shows the same");
      return Result();
    }
    CheckFolders(status);
    CheckWatches(status);
    CheckSpace(status);
    CheckStale(status);
    return Result();
  }

 private:
  void Add(const std::string& check, const std::string& level, const std::string& message,
           const std::string& action = "") {
    Json::Value f(Json::objectValue);
    f["check"] = check;
    f["level"] = level;
    f["message"] = message;
    f["action"] = action;
    findings_.append(f);
    if (level == "problem") ok_ = false;
  }

  Json::Value Result() const {
    Json::Value result(Json::objectValue);
    result["ok"] = ok_;
    result["findings"] = findings_;
    return result;
  }

  void CheckConfig() {
    try {
      auto config = platform::LoadPlatformConfig();
      Add("shares", "ok",
          std::to_string(config->shares.size()) + " share(s) from " + config->source);
      for (const std::string& skipped : config->skipped) Add("shares", "note", skipped);
    } catch (const Error& e) {
      Add("shares", "problem", ReasonOf(e.message),
          "fix what the message names; nothing is indexed until then");
    }
  }

  void CheckDaemons() {
    Json::Value reply;
    std::string error;
    Json::Value req(Json::objectValue);
    req["command"] = "index_list";
    req["data"] = Json::Value(Json::objectValue);
    bool all_up = DaemonExchange(RootedPath(kElasticdSockPath), JsonToString(req), reply, error);
    if (!all_up) Down("quixelasticd", error);
    Json::Value cmd(Json::objectValue);
    cmd["type"] = "status";
    cmd["data"] = Json::Value();
    indexer_up_ = DaemonExchange(RootedPath(kFileIndexdSockPath),
                                 JsonToString(cmd) + std::string(1, '\0'), reply, error);
    if (!indexer_up_) Down("fileindexd", error);
    // The file-change daemon has no socket: its pid file names a live process or it is down.
    if (!DaemonRunning("quixnotifyd")) {
      all_up = false;
      Down("quixnotifyd", "no running process in " + RootedPath("/var/run/quixnotifyd.pid") +
                              "; changes made now reach the index only by a re-index");
    }
    if (all_up && indexer_up_) Add("daemons", "ok", "quixelasticd, fileindexd and quixnotifyd answer");
  }

  void Down(const std::string& daemon, const std::string& why) {
    Add("daemons", "problem", daemon + " does not answer: " + why,
        "start it (systemctl start " + daemon + ") and look at its log");
  }

  void CheckFolders(const Json::Value& status) {
    std::set<std::string> seen_shares;
    bool all_there = true;
    for (const Json::Value& folder : status["folders"]) {
      const std::string path = folder["path"].asString();
      const std::string share = fileindex::GetShareNameByPath(path);
      std::string full;
      try {
        full = fileindex::GetFullPath(path);
      } catch (const Error& e) {
        all_there = false;
        if (seen_shares.insert(share).second) {
          Add("folders", "problem", "share " + share + " of indexed folder " + path +
                                        " is not configured: " + ReasonOf(e.message),
              "configure the share again, or remove its folders: fileindexctl folder delete " +
                  path);
        }
        continue;
      }
      struct stat st;
      const int rc = stat(full.c_str(), &st);
      if (rc != 0 || !S_ISDIR(st.st_mode)) {
        all_there = false;
        const std::string why = rc != 0 ? strerror(errno) : "not a folder";
        Add("folders", "problem", "indexed folder " + path + " (" + full + ") is missing: " + why,
            "mount or restore it, or stop indexing it: fileindexctl folder delete " + path);
        continue;
      }
      full_paths_.push_back(full);
    }
    if (all_there) {
      Add("folders", "ok", std::to_string(status["folders"].size()) + " indexed folder(s) present");
    }
  }

  void CheckWatches(const Json::Value& status) {
    for (const Json::Value& share : status["summary"]["shares"]) {
      if (share["watch_limit"].asBool()) {
        Add("watches", "problem",
            "quixnotifyd ran out of inotify watches on share " + share["share"].asString() +
                ": changes below the folders it could not watch are missed",
            "raise fs.inotify.max_user_watches (sysctl, and a file in /etc/sysctl.d), then "
            "fileindexctl share rebuild " + share["share"].asString());
      }
    }
    const long long limit = WatchLimit();
    if (limit <= 0) {
      Add("watches", "note", "the inotify watch limit cannot be read");
      return;
    }
    // Each folder of an indexed tree takes one watch. Counting stops once past the limit, so a
    // huge tree costs no more than the limit's worth of directory reads.
    uint64_t folders = 0;
    for (const std::string& top : TopFolders()) {
      folders += CountFolders(top, static_cast<uint64_t>(limit) + 1 - folders);
      if (folders > static_cast<uint64_t>(limit)) break;
    }
    const std::string raise = "raise it: sysctl fs.inotify.max_user_watches=" +
                              std::to_string(std::max<uint64_t>(folders * 2, 65536)) +
                              " and keep it in a file in /etc/sysctl.d";
    if (folders > static_cast<uint64_t>(limit)) {
      Add("watches", "problem",
          "the indexed trees hold more than " + std::to_string(limit) +
              " folders, more than fs.inotify.max_user_watches (" + std::to_string(limit) +
              "): changes in the folders past it are missed",
          raise);
    } else if (folders * 10 > static_cast<uint64_t>(limit) * 8) {
      Add("watches", "note",
          "the indexed trees hold " + std::to_string(folders) +
              " folders, close to fs.inotify.max_user_watches (" + std::to_string(limit) + ")",
          raise);
    } else {
      Add("watches", "ok", std::to_string(folders) + " folder(s) to watch, limit " +
                               std::to_string(limit));
    }
  }

  void CheckSpace(const Json::Value& status) {
    std::vector<std::pair<std::string, std::string>> places;  // what, path
    for (const Json::Value& share : status["summary"]["shares"]) {
      const std::string name = share["share"].asString();
      try {
        places.push_back({"share " + name + " (its files and its index)",
                          fileindex::GetFullPath("/" + name)});
      } catch (const Error&) {
        // Reported by the folder check.
      }
    }
    places.push_back({"the system's state files", RootedPath(kStateDir)});
    bool low = false;
    for (const auto& [what, path] : places) {
      std::string existing = path;
      struct stat st;
      while (stat(existing.c_str(), &st) != 0 && existing.size() > 1) {
        existing = existing.substr(0, std::max<size_t>(existing.rfind('/'), 1));
      }
      if (platform::QUIXQuotaIsEnough(0, existing.c_str(), kLowSpaceBytes) != 0) continue;
      low = true;
      struct statvfs vfs;
      const std::string free_text =
          statvfs(existing.c_str(), &vfs) == 0
              ? HumanSize(static_cast<uint64_t>(vfs.f_bavail) * vfs.f_frsize) + " free"
              : "almost no space";
      Add("space", "problem",
          what + ": the volume of " + existing + " has " + free_text + ", less than " +
              HumanSize(kLowSpaceBytes),
          "free space on that volume; indexing there stops until it has room");
    }
    if (!low) Add("space", "ok", "every indexed share's volume has room");
  }

  void CheckStale(const Json::Value& status) {
    const Json::Value& summary = status["summary"];
    if (summary["paused"].asBool()) {
      const long long until = summary["resume_time"].asInt64();
      Add("index", "note",
          std::string("indexing is paused") + (until > 0 ? " until " + HumanTime(until) : ""),
          "fileindexctl resume");
    }
    const int64_t now = Env::Current()->Now();
    bool stale = false;
    for (const Json::Value& share : summary["shares"]) {
      const std::string name = share["share"].asString();
      const Json::Value* worker = nullptr;
      for (const Json::Value& w : status["indexer"]["data"]["shares"]) {
        if (w["share"].asString() == name) worker = &w;
      }
      const uint64_t queued = share["queue_length"].asUInt64();
      if (share["need_reindex"].asBool()) {
        stale = true;
        Add("index", "problem", "share " + name + " lost changes and needs a re-index",
            "fileindexctl share rebuild " + name);
      }
      if (queued == 0 || !indexer_up_ || summary["paused"].asBool() ||
          share["volume_paused"].asBool()) {
        continue;
      }
      // An idle worker with changes waiting since its last pass ended has stopped following;
      // one before its first pass (in a daemon just started) has nothing to judge yet.
      if (worker == nullptr) {
        stale = true;
        Add("index", "problem",
            "share " + name + ": " + std::to_string(queued) +
                " change(s) wait but fileindexd has no worker for it",
            "fileindexctl services prepare, then look at fileindexd's log");
      } else if ((*worker)["state"].asString() == "idle" && (*worker)["last_pass"].asInt64() > 0 &&
                 now - (*worker)["last_pass"].asInt64() > kStaleSeconds) {
        stale = true;
        Add("index", "problem",
            "share " + name + ": " + std::to_string(queued) +
                " change(s) wait and the last pass ended " +
                HumanTime((*worker)["last_pass"].asInt64()),
            "look at fileindexctl status and fileindexd's log for the share's last error");
      }
    }
    if (!stale) Add("index", "ok", "no share's index is behind");
  }

  // The indexed folders that are not inside another indexed folder.
  std::vector<std::string> TopFolders() const {
    std::vector<std::string> tops;
    std::set<std::string> sorted(full_paths_.begin(), full_paths_.end());
    for (const std::string& path : sorted) {
      if (!tops.empty() && path.compare(0, tops.back().size() + 1, tops.back() + "/") == 0) continue;
      tops.push_back(path);
    }
    return tops;
  }

  static bool DaemonRunning(const std::string& name) {
    return DaemonStateOf(name)["running"].asBool();
  }

  // Folders at and below `top`, not following links nor entering the system's own @eaDir;
  // stops counting at `cap`.
  static uint64_t CountFolders(const std::string& top, uint64_t cap) {
    uint64_t count = 0;
    std::vector<std::string> pending = {top};
    while (!pending.empty() && count < cap) {
      const std::string dir = pending.back();
      pending.pop_back();
      ++count;
      std::unique_ptr<DIR, int (*)(DIR*)> handle(opendir(dir.c_str()), closedir);
      if (!handle) continue;
      while (struct dirent* entry = readdir(handle.get())) {
        const std::string name = entry->d_name;
        if (name == "." || name == ".." || name == "@eaDir") continue;
        bool is_dir = entry->d_type == DT_DIR;
        if (entry->d_type == DT_UNKNOWN) {
          struct stat st;
          is_dir = lstat((dir + "/" + name).c_str(), &st) == 0 && S_ISDIR(st.st_mode);
        }
        if (is_dir) pending.push_back(dir + "/" + name);
      }
    }
    return count;
  }

  // The kernel's per-user watch limit; tests stand in for it through the platform seam.
  static long long WatchLimit() {
    if (auto fault = platform::FaultFor("InotifyMaxUserWatches")) return fault->out;
    std::ifstream in("/proc/sys/fs/inotify/max_user_watches");
    long long limit = -1;
    return in >> limit ? limit : -1;
  }

  Json::Value findings_ = Json::Value(Json::arrayValue);
  bool ok_ = true;
  bool indexer_up_ = false;
  std::vector<std::string> full_paths_;
};

}  // namespace

Json::Value Diagnose() { return Doctor().Run(); }

void PrintDiagnosis(const Json::Value& diagnosis, std::ostream& os) {
  for (const char* level : {"problem", "note", "ok"}) {
    for (const Json::Value& f : diagnosis["findings"]) {
      if (f["level"].asString() != level) continue;
      os << std::left << std::setw(9) << (std::string(level) == "problem" ? "PROBLEM" : level)
         << f["check"].asString() << ": " << f["message"].asString();
      if (!f["action"].asString().empty()) os << "\n         what to do: " << f["action"].asString();
      os << '\n';
    }
  }
  os << (diagnosis["ok"].asBool()
             ? "\nnothing stops indexing\n"
             : "\nindexing is stopped or incomplete until the problems above are fixed\n");
}

}  // namespace ctl
}  // namespace orvane
