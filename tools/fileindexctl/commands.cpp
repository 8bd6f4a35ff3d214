#include "tools/fileindexctl/commands.hpp"

#include <pwd.h>
#include <signal.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <climits>
#include <cstring>
#include <fstream>
#include <iostream>
#include <sstream>

#include "common/env.hpp"
#include "common/error.hpp"
#include "common/json_util.hpp"
#include "common/name_codec.hpp"
#include "common/root.hpp"
#include "common/sdk/share.hpp"
#include "common/util.hpp"
#include "common/wire.hpp"
#include "fileindex/elastic_control.hpp"
#include "fileindex/index_mgr.hpp"
#include "fileindex/notifyd_cfg.hpp"
#include "fileindex/optree.hpp"
#include "fileindex/queue_mgr.hpp"
#include "fileindex/status_mgr.hpp"
#include "fileindex/util.hpp"
#include "platform/daemon_sock.hpp"
#include "tools/fileindexctl/doctor.hpp"
#include "tools/fileindexctl/spotlight_conf.hpp"

namespace orvane {
namespace ctl {

void Output::Emit(const Json::Value& value, const std::function<void(std::ostream&)>& human) {
  if (json_) {
    out_ << JsonToStyledString(value, "  ") << '\n';
  } else {
    // Names are bytes; a terminal gets valid text, with U+FFFD for what is not UTF-8.
    std::ostringstream text;
    human(text);
    out_ << DisplayName(text.str());
  }
}

void Output::Done(const std::string& message) {
  Json::Value ok(Json::objectValue);
  ok["success"] = true;
  Emit(ok, [&message](std::ostream& out) { out << message << '\n'; });
}

namespace {

using namespace orvane::fileindex;  // NOLINT: the operations read best unqualified here

// A folder named on the command line: a share path ("/music/rock") as the configuration keeps
// it, or a folder on disk inside a share, turned into its share path.
std::string SharePathOf(const std::string& arg) {
  if (!arg.empty() && arg[0] == '/' && IsDirExist(arg, true)) {
    try {
      std::string share_name;
      std::string share_path;
      GetShareNamePathByFullPath(share_name, share_path, RealPath(arg));
      return "/" + share_name + RealPath(arg).substr(share_path.size());
    } catch (const Error&) {
      // Not inside a share on this disk: it may still be a share path.
    }
  }
  return arg;
}

Json::Value SharePaths(const Args& args, const std::string& what) {
  Json::Value paths(Json::arrayValue);
  args.At(0, what);
  for (const std::string& p : args.positional()) paths.append(SharePathOf(p));
  return paths;
}

std::string CurrentUserName() {
  struct passwd* pw = getpwuid(geteuid());
  return pw != nullptr ? pw->pw_name : std::to_string(geteuid());
}

std::string Kinds(const Json::Value& folder) {
  std::string kinds;
  for (const char* kind : {"document", "audio", "video", "photo"}) {
    if (folder[kind].asBool()) kinds += std::string(kinds.empty() ? "" : ",") + kind;
  }
  return kinds.empty() ? "names only" : kinds;
}

std::string StatusText(const Json::Value& folder) {
  const Json::Value& status = folder["additional"]["status"];
  if (!status.isObject()) return "";
  std::string text = status["text"].asString();
  if (status.isMember("desc")) text += " (" + status["desc"].asString() + ")";
  return text;
}

void ApplyFolderOptions(const Args& args, Json::Value& folder) {
  if (args.Has("name")) folder["name"] = args.Get("name");
  for (const char* kind : {"document", "audio", "video", "photo"}) {
    folder[kind] = args.GetSwitch(kind, folder[kind].asBool());
  }
  if (args.Has("group")) folder["group"] = args.Get("group");
  if (args.Has("owner")) folder["owner"] = args.Get("owner");
}

// One request and one reply over a daemon's socket; false with the reason when the daemon
// cannot be reached or answers garbage.
bool Exchange(const std::string& socket, const std::string& payload, Json::Value& reply,
              std::string& error) {
  quixdaemon::DomainSockConnection conn(socket);
  conn.SetTimeouts(30000, 30000);
  std::string text;
  if (!conn.Connect(2000) || !conn.Send(payload) || !conn.Recv(text)) {
    error = socket + ": " + std::strerror(errno);
    return false;
  }
  JsonValue parsed;
  if (!parsed.fromString(text) || !parsed.isObject()) {
    error = socket + ": the reply is not a JSON object";
    return false;
  }
  reply = parsed;
  return true;
}

// The share whose index is `id`; empty when the id is not one of ours.
std::string ShareOfIndex(const std::string& id) {
  const std::string prefix = elastic::GetFileIndexID("");
  return StringStartWith(id, prefix) && id.size() > prefix.size() ? id.substr(prefix.size()) : "";
}

std::string RebuildCommand(const std::string& share) {
  return "\"fileindexctl share rebuild " + share + "\"";
}

// The engine names the index in its message ("index fileindex_docs is damaged ..."); people
// need the share and the command that builds it again.
std::string DamagedIndexText(const std::string& engine_msg) {
  std::string share;
  const size_t at = engine_msg.find(elastic::GetFileIndexID(""));
  if (at != std::string::npos) {
    const size_t end = engine_msg.find(' ', at);
    share = ShareOfIndex(engine_msg.substr(at, end == std::string::npos ? end : end - at));
  }
  if (share.empty()) return engine_msg + " (run \"fileindexctl status\" as root to see which)";
  return "the index of share " + share + " cannot be read and was set aside; " +
         RebuildCommand(share) + " builds it again";
}

// A people's command to the search engine, on its public socket when there is one.
Json::Value AskEngine(const std::string& command, const Json::Value& data) {
  Json::Value req(Json::objectValue);
  req["command"] = command;
  req["data"] = data;
  std::string socket = RootedPath(kElasticdSearchSockPath);
  if (access(socket.c_str(), F_OK) != 0) socket = RootedPath(kElasticdSockPath);
  Json::Value reply;
  std::string error;
  if (!Exchange(socket, JsonToString(req), reply, error)) throw Error(kErrElastic, error);
  if (!reply["success"].isBool() || !reply["success"].asBool()) {
    const Json::Value& err = reply["error"];
    // A damaged index is not an engine out of reach: the engine set its files aside and it
    // stays unusable until it is built again.
    if (err.isObject() && err["code"].asInt() == kErrIndexDamaged) {
      throw Error(kErrIndexDamaged, DamagedIndexText(err["msg"].asString()));
    }
    if (!err.isObject()) throw Error(kErrElastic, JsonToString(reply));
    throw EngineRefusal(err["code"].asInt(), err["msg"].asString());
  }
  return reply["data"];
}

// ---- folders

void FolderAddCmd(const Args& args, Output& out) {
  if (args.Has("name") && args.positional().size() > 1) {
    throw UsageError("--name names one folder: give a single PATH with it");
  }
  Json::Value list(Json::arrayValue);
  for (const Json::Value& path : SharePaths(args, "PATH")) {
    Json::Value folder(Json::objectValue);
    folder["path"] = path;
    folder["name"] = Basename(path.asString());
    folder["document"] = true;
    folder["audio"] = folder["video"] = folder["photo"] = false;
    folder["owner"] = CurrentUserName();
    folder["privileged"] = geteuid() == 0;
    ApplyFolderOptions(args, folder);
    list.append(folder);
  }
  FolderAdd(list, false);
  out.Done("added " + std::to_string(list.size()) + " folder(s); indexing starts at once");
}

void FolderSetCmd(const Args& args, Output& out) {
  const std::string path = SharePathOf(args.At(0, "PATH"));
  Json::Value folder = FolderGet(path, Json::Value(Json::arrayValue));
  ApplyFolderOptions(args, folder);
  Json::Value list(Json::arrayValue);
  list.append(folder);
  FolderSet(list, false);
  out.Done("updated " + path);
}

void FolderDeleteCmd(const Args& args, Output& out) {
  const Json::Value paths = SharePaths(args, "PATH");
  FolderDelete(paths);
  out.Done("removed " + std::to_string(paths.size()) + " folder(s) from the index");
}

void FolderReindexCmd(const Args& args, Output& out) {
  const Json::Value paths = SharePaths(args, "PATH");
  FolderReindex(paths);
  out.Done("queued " + std::to_string(paths.size()) + " folder(s) for re-indexing");
}

// The indexing daemon's status and the worker of `share` in it (null when there is none).
Json::Value IndexerStatus();
const Json::Value& EntryWith(const Json::Value& list, const char* key, const std::string& value);

void FolderCheckCmd(const Args& args, Output& out) {
  const std::string path = SharePathOf(args.At(0, "PATH"));
  const long long timeout = args.GetInt("timeout", 0);
  std::string full;
  std::string share;
  std::string queue;
  {
    FolderMgr folders;
    std::shared_ptr<Folder> folder;
    folders.Get(folder, path);
    full = folder->GetFullPath();
    share = folder->GetShare();
    queue = sdk::SDKShare(share).GetQueuePath();
  }
  Json::Value result(Json::objectValue);
  result["path"] = path;
  result["folder"] = full;
  // A full re-index already queued reads the folder again anyway, and no check is added.
  if (QueueMgr(queue).IsFullPathHasReindex(full)) {
    result["finished"] = false;
    result["covered_by_reindex"] = true;
    out.Emit(result, [&path](std::ostream& os) {
      os << "a full re-index of " << path << " is already queued; it covers the check\n";
    });
    return;
  }
  // Passes that take a batch are numbered: the check's result is the first reconciliation of
  // the folder by a pass after the ones already under way.
  const Json::Value before = IndexerStatus();
  const Json::Value& worker = EntryWith(before["data"]["shares"], "share", share);
  const uint64_t passes = worker["passes"].asUInt64();
  Json::Value data(Json::objectValue);
  data[kReconcileKey] = true;
  AddCustomEvent(kEventReindex, full, "", data);
  if (!worker.isObject()) {
    result["finished"] = false;
    result["queued"] = true;
    out.Emit(result, [&](std::ostream& os) {
      os << "queued a check of " << path << "; fileindexd is not indexing share " << share
         << " now (stopped or paused): it runs when indexing resumes\n";
    });
    return;
  }
  const bool terminal = &out.stream() == &std::cout && isatty(STDOUT_FILENO) == 1;
  const int64_t start = Env::Current()->NowMicros();
  for (;;) {
    const Json::Value status = IndexerStatus();
    ORVANE_THROW_IF(status.isNull(), kErrSystem,
                    "fileindexd stopped while checking " + path +
                        "; the check stays queued and runs when it starts again");
    const Json::Value& w = EntryWith(status["data"]["shares"], "share", share);
    for (const Json::Value& r : w["reconciliations"]) {
      if (r["folder"].asString() != full || r["pass"].asUInt64() <= passes) continue;
      if (terminal) out.stream() << '\n';
      for (const auto& name : r.getMemberNames()) result[name] = r[name];
      result["finished"] = true;
      out.Emit(result, [&](std::ostream& os) {
        os << "checked " << path << " in " << r["duration_ms"].asInt64() / 1000.0
           << " s: " << r["compared"].asUInt64() << " entries compared, " << r["added"].asUInt64()
           << " added, " << r["removed"].asUInt64() << " removed, " << r["refreshed"].asUInt64()
           << " refreshed\n";
      });
      return;
    }
    // The check's line is gone from the queue without a result of its own: a full re-index of
    // the folder queued meanwhile took its place.
    if (w["passes"].asUInt64() > passes && w["queue_length"].asUInt64() == 0 &&
        !w["reconciling"].isObject()) {
      result["finished"] = false;
      result["covered_by_reindex"] = true;
      out.Emit(result, [&path](std::ostream& os) {
        os << "a full re-index of " << path << " took the place of the check\n";
      });
      return;
    }
    if (terminal && w["reconciling"]["folder"].asString() == full) {
      out.stream() << "\rchecking " << path << ": " << w["reconciling"]["compared"].asUInt64()
                   << " entries compared" << std::flush;
    }
    const int64_t now = Env::Current()->NowMicros();
    if (timeout > 0 && now - start > timeout * 1000000) {
      if (terminal) out.stream() << '\n';
      throw Error(kErrSystem, "the check of " + path + " did not finish within " +
                                  std::to_string(timeout) +
                                  " s; it stays queued (\"fileindexctl status\" shows it)");
    }
    Env::Current()->SleepMicros(200000);
  }
}

void FolderListCmd(const Args& args, Output& out) {
  Json::Value req(Json::objectValue);
  if (args.Has("keyword")) req["keyword"] = args.Get("keyword");
  if (args.Has("group")) req["group"] = args.Get("group");
  if (args.Has("sort")) req["sort_by"] = args.Get("sort");
  req["sort_direction"] = args.Has("desc") ? "desc" : "asc";
  if (args.Has("offset")) req["offset"] = static_cast<Json::UInt>(args.GetInt("offset", 0));
  if (args.Has("limit")) req["limit"] = static_cast<Json::UInt>(args.GetInt("limit", 0));
  req["additional"].append("status");
  const Json::Value res = FolderList(req);
  out.Emit(res, [&res](std::ostream& os) {
    Table table({"PATH", "NAME", "CONTENT", "GROUP", "STATUS"});
    for (const Json::Value& f : res["folders"]) {
      table.Add({f["path"].asString(), f["name"].asString(), Kinds(f), f["group"].asString(),
                 StatusText(f)});
    }
    if (table.empty()) {
      os << "no indexed folders (add one with \"fileindexctl folder add PATH\")\n";
      return;
    }
    table.Print(os);
    os << res["folders"].size() << " of " << res["total"].asUInt() << " folder(s)\n";
  });
}

void FolderGetCmd(const Args& args, Output& out) {
  Json::Value additional(Json::arrayValue);
  additional.append("status");
  const Json::Value f = FolderGet(SharePathOf(args.At(0, "PATH")), additional);
  out.Emit(f, [&f](std::ostream& os) {
    Table table({"FIELD", "VALUE"});
    table.Add({"path", f["path"].asString()});
    table.Add({"name", f["name"].asString()});
    table.Add({"content", Kinds(f)});
    table.Add({"owner", f["owner"].asString()});
    table.Add({"group", f["group"].asString()});
    table.Add({"paused", YesNo(f["paused"].asBool())});
    table.Add({"status", StatusText(f)});
    table.Print(os);
  });
}

void FolderGroupsCmd(const Args&, Output& out) {
  const Json::Value groups = FolderListGroups();
  out.Emit(groups, [&groups](std::ostream& os) {
    for (const Json::Value& g : groups) os << g.asString() << '\n';
  });
}

// ---- shares, volumes, users, homes

// A command that names one thing (or two, the second its new name or place), hands it to the
// library and says what it did: usage and argument count follow from the argument names.
Command OneArg(const char* group, const char* name, const std::string& what, const char* summary,
               void (*op)(const std::string&), const std::string& done) {
  return {group, name, what, summary, {}, {}, 1, [op, what, done](const Args& args, Output& out) {
            const std::string value = args.At(0, what);
            op(value);
            out.Done(done + " " + value);
          }};
}

Command TwoArgs(const char* group, const char* name, const std::string& first,
                const std::string& second, const char* summary,
                void (*op)(const std::string&, const std::string&), const std::string& done) {
  return {
      group, name, first + " " + second, summary, {}, {}, 2, [=](const Args& args, Output& out) {
        const std::string a = args.At(0, first);
        const std::string b = args.At(1, second);
        op(a, b);
        out.Done(done + " " + a + " -> " + b);
      }};
}

unsigned int Uid(const Args& args) {
  const std::string text = args.At(0, "UID or user name");
  if (struct passwd* pw = getpwnam(text.c_str())) return pw->pw_uid;
  char* end = nullptr;
  const unsigned long uid = std::strtoul(text.c_str(), &end, 10);
  if (text.empty() || *end != '\0' || uid > UINT_MAX) {
    throw UsageError("\"" + text + "\" is neither a user name nor a user id");
  }
  return static_cast<unsigned int>(uid);
}

platform::AUTH_TYPE Auth(const Args& args) {
  const std::string auth = args.Get("auth", "all");
  if (auth == "local") return platform::AUTH_LOCAL;
  if (auth == "domain") return platform::AUTH_DOMAIN;
  if (auth == "ldap") return platform::AUTH_LDAP;
  if (auth == "all") return platform::AUTH_ALL;
  throw UsageError("--auth takes local, domain, ldap or all");
}

Command UserHome(const char* name, const char* summary, void (*op)(unsigned int),
                 const std::string& done) {
  return {"user", name, "USER", summary, {}, {}, 1, [op, done](const Args& args, Output& out) {
            op(Uid(args));
            out.Done(done + " " + args.At(0, "USER"));
          }};
}

Command HomeService(const char* name, const char* summary, void (*op)(platform::AUTH_TYPE)) {
  return {"home",
          name,
          "[--auth local|domain|ldap|all]",
          summary,
          {"auth"},
          {},
          0,
          [op](const Args& args, Output& out) {
            op(Auth(args));
            out.Done("home recycle bins queued for re-indexing");
          }};
}

// ---- search

Json::Value SearchRequest(const Args& args) {
  Json::Value data(Json::objectValue);
  std::string keywords;
  for (const std::string& word : args.positional())
    keywords += (keywords.empty() ? "" : " ") + word;
  if (!keywords.empty()) data["keyword"] = keywords;
  if (args.Has("name")) data["name"] = args.Get("name");
  if (args.Has("folder")) {
    std::string folder = args.Get("folder");
    // A share path is searched as the folder it names on disk.
    if (!IsDirExist(folder, true)) {
      try {
        folder = GetFullPath(folder);
      } catch (const Error&) {
      }
    }
    data["folder"] = folder;
  }
  if (args.Has("ext")) {
    std::string list = args.Get("ext");
    for (size_t pos = 0; pos <= list.size();) {
      const size_t comma = std::min(list.find(',', pos), list.size());
      if (comma > pos) data["ext"].append(ToLower(list.substr(pos, comma - pos)));
      pos = comma + 1;
    }
  }
  if (args.Has("type")) data["file_type"] = args.Get("type");
  if (args.Has("min-size"))
    data["size_range"]["gte"] = Json::UInt64(ParseSize(args.Get("min-size")));
  if (args.Has("max-size"))
    data["size_range"]["lte"] = Json::UInt64(ParseSize(args.Get("max-size")));
  if (args.Has("after")) data["mtime_range"]["gte"] = Json::Int64(ParseTime(args.Get("after")));
  if (args.Has("before")) data["mtime_range"]["lte"] = Json::Int64(ParseTime(args.Get("before")));
  if (args.Has("sort")) data["sort"] = args.Get("sort");
  if (args.Has("desc")) data["order"] = "desc";
  data["from"] = static_cast<Json::Int64>(args.GetInt("from", 0));
  data["size"] = static_cast<Json::Int64>(args.GetInt("size", 20));
  if (args.Has("share")) data["id"] = elastic::GetFileIndexID(args.Get("share"));
  if (data.size() == 2 + (args.Has("share") ? 1 : 0)) {
    throw UsageError("give keywords, --name or a filter to search for");
  }
  // Asked after the check above: it is a scope, not something to search for.
  if (args.Has("all-servers")) data["servers"] = "all";
  return data;
}

// Engine snippets mark matches with <b></b>; a terminal shows them between asterisks.
std::string PlainSnippet(std::string text) {
  for (const char* tag : {"<b>", "</b>"}) {
    for (size_t pos; (pos = text.find(tag)) != std::string::npos;)
      text.replace(pos, strlen(tag), "*");
  }
  std::replace(text.begin(), text.end(), '\n', ' ');
  return text;
}

void SearchCmd(const Args& args, Output& out) {
  const Json::Value req = SearchRequest(args);
  const Json::Value res = AskEngine("search", req);
  out.Emit(res, [&res, &req](std::ostream& os) {
    const Json::Value& hits = res["hits"];
    if (hits.empty()) {
      os << "no files found\n";
      return;
    }
    // Hits of a search over every file server sharing the engine's database name theirs.
    const bool servers = hits[0].isMember("server");
    Table table(servers ? std::vector<std::string>{"NAME", "SIZE", "MODIFIED", "SERVER", "FOLDER"}
                        : std::vector<std::string>{"NAME", "SIZE", "MODIFIED", "FOLDER"});
    for (const Json::Value& hit : hits) {
      const std::string path = hit["path"].asString();
      std::vector<std::string> row = {
          hit["name"].asString() + (hit["is_dir"].asBool() ? "/" : ""),
          hit["is_dir"].asBool() ? "-" : HumanSize(hit["size"].asUInt64()),
          HumanTime(hit["mtime"].asInt64())};
      if (servers) row.push_back(hit["server"].asString());
      row.push_back(Dirname(path));
      table.Add(row);
    }
    table.Print(os);
    bool snippets = false;
    for (const Json::Value& hit : hits) {
      if (!hit["snippet"].isString() || hit["snippet"].asString().empty()) continue;
      if (!snippets) os << '\n';
      snippets = true;
      os << hit["path"].asString() << "\n    " << PlainSnippet(hit["snippet"].asString()) << '\n';
    }
    const Json::Int64 from = req["from"].asInt64();
    os << "showing " << from + 1 << "-" << from + static_cast<Json::Int64>(hits.size()) << " of "
       << res["total"].asInt64() << (res["total_exact"].asBool() ? "" : "+") << " file(s)\n";
  });
}

void SuggestCmd(const Args& args, Output& out) {
  Json::Value data(Json::objectValue);
  data["prefix"] = args.At(0, "PREFIX");
  data["size"] = static_cast<Json::Int64>(args.GetInt("size", 10));
  const Json::Value res = AskEngine("suggest", data);
  out.Emit(res, [&res](std::ostream& os) {
    for (const Json::Value& s : res["suggestions"]) os << s.asString() << '\n';
  });
}

// ---- pause and services

Json::Value DaemonState(const std::string& name);

// The indexing daemon's answer to "status"; false with the reason when it cannot be asked.
bool AskIndexerStatus(Json::Value& reply, std::string& error) {
  Json::Value cmd(Json::objectValue);
  cmd["type"] = "status";
  cmd["data"] = Json::Value();
  return Exchange(RootedPath(kFileIndexdSockPath), JsonToString(cmd) + std::string(1, '\0'), reply,
                  error);
}

// Runs a pause or resume, which records the choice in the status file and then tells the
// indexing daemon. The command channel ignores what the daemon answers, so the daemon is asked
// afterwards which pause it holds. One that is not running reads the file when it starts, so the
// choice holds; one that is running and holds another pause is a failure, though the file has it.
void TellIndexer(const std::function<void()>& change, const std::string& done, Output& out) {
  std::string refused;
  try {
    change();
  } catch (const Error& e) {
    if (e.code != kErrSystem) throw;
    refused = ReasonOf(e.message);
  }
  if (!DaemonState("fileindexd")["running"].asBool()) {
    out.Done(done + " (fileindexd is not running: it applies when fileindexd starts)");
    return;
  }
  if (refused.empty()) {
    Json::Value reply;
    const long long wanted = StatusMgr().GetPauseInfo();
    if (AskIndexerStatus(reply, refused) && reply["data"]["resume_time"].asInt64() != wanted) {
      refused = "it holds resume time " + std::to_string(reply["data"]["resume_time"].asInt64()) +
                " instead of " + std::to_string(wanted);
    }
  }
  if (!refused.empty()) {
    throw Error(kErrSystem, "recorded, but the running fileindexd did not take it: " + refused +
                                "; it applies at fileindexd's next start");
  }
  out.Done(done);
}

void PauseCmd(const Args& args, Output& out) {
  const long long hours = args.GetInt("hours", 0);
  if (hours < 0 || hours > 24 * 365) throw UsageError("--hours takes 0 to 8760");
  TellIndexer([hours] { StatusMgr().Pause(static_cast<int>(hours)); },
              hours == 0 ? "indexing paused until \"fileindexctl resume\""
                         : "indexing paused for " + std::to_string(hours) + " hour(s)",
              out);
}

void ResumeCmd(const Args&, Output& out) {
  TellIndexer([] { StatusMgr().Resume(); }, "indexing resumed", out);
}

void ServicesPrepareCmd(const Args&, Output& out) {
  PrepareServices();
  out.Done("services switched to match the indexed folders");
}

// ---- status

// A daemon is running when its pid file names a live process.
Json::Value DaemonState(const std::string& name) {
  Json::Value state(Json::objectValue);
  state["name"] = name;
  state["running"] = false;
  std::ifstream in(RootedPath("/var/run/" + name + ".pid"));
  long pid = 0;
  if (in >> pid && pid > 0 && (kill(static_cast<pid_t>(pid), 0) == 0 || errno == EPERM)) {
    state["running"] = true;
    state["pid"] = static_cast<Json::Int64>(pid);
  }
  return state;
}

// What the search engine says of each index (id, state, documents); empty when it cannot be
// asked: not running, or the caller is neither root nor the service account.
Json::Value EngineIndexes() {
  Json::Value req(Json::objectValue);
  req["command"] = "index_list";
  req["data"] = Json::Value(Json::objectValue);
  Json::Value reply;
  std::string error;
  if (!Exchange(RootedPath(kElasticdSockPath), JsonToString(req), reply, error) ||
      !reply["success"].asBool() || !reply["data"].isArray()) {
    return Json::Value(Json::arrayValue);
  }
  return reply["data"];
}

// The indexing daemon's reply to "status"; null when it cannot be asked.
Json::Value IndexerStatus() {
  Json::Value reply;
  std::string error;
  return AskIndexerStatus(reply, error) ? reply : Json::Value();
}

Json::Value CollectStatus() {
  Json::Value status(Json::objectValue);
  for (const char* daemon : {"quixelasticd", "fileindexd", "quixnotifyd"}) {
    status["daemons"].append(DaemonState(daemon));
  }
  status["summary"] = FolderSummary();
  Json::Value req(Json::objectValue);
  req["additional"].append("status");
  status["folders"] = FolderList(req)["folders"];
  // The indexing daemon's own counters, when it is up.
  Json::Value reply;
  std::string error;
  if (AskIndexerStatus(reply, error)) status["indexer"] = reply;
  status["indexes"] = EngineIndexes();
  return status;
}

uint64_t QueuedEvents(const Json::Value& status) {
  uint64_t queued = 0;
  for (const Json::Value& share : status["summary"]["shares"]) {
    queued += share["queue_length"].asUInt64();
  }
  return queued;
}

uint64_t DocumentsWritten(const Json::Value& status) {
  uint64_t written = 0;
  for (const Json::Value& share : status["indexer"]["data"]["shares"]) {
    written += share["documents_written"].asUInt64();
  }
  return written;
}

// The entry of `list` whose `key` is `value`; null when there is none.
const Json::Value& EntryWith(const Json::Value& list, const char* key, const std::string& value) {
  static const Json::Value kNone;
  for (const Json::Value& entry : list) {
    if (entry[key].asString() == value) return entry;
  }
  return kNone;
}

// What needs an administrator's eye about a share, or "ok".
std::string ShareState(const Json::Value& summary, const Json::Value& worker,
                       const Json::Value& index) {
  std::vector<std::string> notes;
  if (worker["paused"].asBool() || summary["volume_paused"].asBool()) notes.push_back("paused");
  if (summary["need_reindex"].asBool()) notes.push_back("needs re-index");
  if (worker["out_of_space"].asBool()) notes.push_back("out of space");
  if (summary["queue_no_space"].asBool()) notes.push_back("queue volume full");
  if (summary["watch_limit"].asBool()) notes.push_back("watch limit reached");
  if (worker["reconciling"].isObject()) {
    notes.push_back("reconciling " + SharePathOf(worker["reconciling"]["folder"].asString()) +
                    ", " + std::to_string(worker["reconciling"]["compared"].asUInt64()) +
                    " entries compared");
  }
  if (!worker["unsafe"].asString().empty()) notes.push_back("refused: unsafe index files");
  const std::string engine = index["state"].asString();
  if (!engine.empty() && engine != "ready") notes.push_back("index " + engine);
  std::string text;
  for (const std::string& note : notes) text += (text.empty() ? "" : ", ") + note;
  return text.empty() ? "ok" : text;
}

void PrintStatus(const Json::Value& status, std::ostream& os) {
  Table daemons({"DAEMON", "STATE", "PID"});
  for (const Json::Value& d : status["daemons"]) {
    daemons.Add({d["name"].asString(), d["running"].asBool() ? "running" : "stopped",
                 d.isMember("pid") ? std::to_string(d["pid"].asInt64()) : "-"});
  }
  daemons.Print(os);
  const Json::Value& summary = status["summary"];
  os << '\n';
  if (summary["paused"].asBool()) {
    const long long until = summary["resume_time"].asInt64();
    os << "indexing is paused" << (until > 0 ? " until " + HumanTime(until) : "") << "\n\n";
  }
  // The indexing daemon's and the engine's columns read "-" while they cannot be asked.
  const bool indexer_up = status.isMember("indexer");
  const bool engine_up = !status["indexes"].empty();
  auto count = [](bool known, const Json::Value& v) {
    return known ? std::to_string(v.asUInt64()) : std::string("-");
  };
  Table shares({"SHARE", "FOLDERS", "QUEUED", "PENDING", "DONE", "DOCUMENTS", "ERRORS", "LAST PASS",
                "STATE"});
  std::vector<std::string> errors;
  std::vector<std::string> notes;
  bool errors_hidden = false;
  for (const Json::Value& s : summary["shares"]) {
    const std::string name = s["share"].asString();
    const Json::Value& worker = EntryWith(status["indexer"]["data"]["shares"], "share", name);
    const Json::Value& index = EntryWith(status["indexes"], "id", elastic::GetFileIndexID(name));
    const bool has_worker = indexer_up && worker.isObject();
    shares.Add({name, std::to_string(s["folder_count"].asUInt()),
                std::to_string(s["queue_length"].asUInt64()),
                count(has_worker, worker["ops_pending"]), count(has_worker, worker["ops_done"]),
                count(engine_up && index.isObject(), index["documents"]),
                count(has_worker, worker["errors"]),
                has_worker ? HumanTime(worker["last_pass"].asInt64()) : "-",
                ShareState(s, worker, index)});
    if (worker["errors"].asUInt64() > 0 && !worker["last_error"].asString().empty()) {
      errors.push_back(name + ": " + worker["last_error"].asString());
    } else if (worker["errors"].asUInt64() > 0 && !worker.isMember("last_error")) {
      errors_hidden = true;  // the daemon keeps the texts, which name files, for administrators
    }
    if (index["state"].asString() == "damaged") {
      notes.push_back(name + ": the search index cannot be read and was set aside; " +
                      RebuildCommand(name) + " builds it again");
    }
    if (worker["long_paths"].asUInt64() > 0) {
      notes.push_back(name + ": " + std::to_string(worker["long_paths"].asUInt64()) +
                      " path(s) of " + std::to_string(PATH_MAX) +
                      " bytes or more cannot be indexed (the system log names the first)");
    }
  }
  if (!shares.empty()) {
    shares.Print(os);
    os << '\n';
  }
  Table reconciled({"RECONCILED FOLDER", "FINISHED", "COMPARED", "ADDED", "REMOVED", "REFRESHED"});
  for (const Json::Value& worker : status["indexer"]["data"]["shares"]) {
    for (const Json::Value& r : worker["reconciliations"]) {
      reconciled.Add(
          {SharePathOf(r["folder"].asString()), HumanTime(r["finished"].asInt64()),
           std::to_string(r["compared"].asUInt64()), std::to_string(r["added"].asUInt64()),
           std::to_string(r["removed"].asUInt64()), std::to_string(r["refreshed"].asUInt64())});
    }
  }
  if (!reconciled.empty()) {
    reconciled.Print(os);
    os << '\n';
  }
  Table folders({"FOLDER", "STATUS"});
  for (const Json::Value& f : status["folders"]) {
    folders.Add({f["path"].asString(), StatusText(f)});
  }
  if (folders.empty()) {
    os << "no indexed folders\n";
  } else {
    folders.Print(os);
  }
  if (!notes.empty()) {
    os << "\nnotes:\n";
    for (const std::string& line : notes) os << "  " << line << '\n';
  }
  if (!errors.empty()) {
    os << "\nlast errors:\n";
    for (const std::string& line : errors) os << "  " << line << '\n';
  }
  if (errors_hidden) {
    os << "\nthe texts of the errors name files: root and the administrators group see them\n";
  }
}

void StatusCmd(const Args& args, Output& out) {
  if (!args.Has("wait")) {
    const Json::Value status = CollectStatus();
    out.Emit(status, [&status](std::ostream& os) { PrintStatus(status, os); });
    return;
  }
  // Waits for the queues to drain. On a terminal a bar is drawn against the largest backlog
  // seen; into a file or a pipe a line is written when the figures change, at most every 5 s.
  const bool terminal = &out.stream() == &std::cout && isatty(STDOUT_FILENO) == 1;
  const long long timeout = args.GetInt("timeout", 0);
  const int64_t start = Env::Current()->NowMicros();
  int64_t last_line = 0;
  std::string last_text;
  uint64_t most = 0;
  for (;;) {
    const Json::Value status = CollectStatus();
    const uint64_t queued = QueuedEvents(status);
    const int64_t now = Env::Current()->NowMicros();
    most = std::max(most, queued);
    if (!out.json()) {
      std::string text = std::to_string(queued) + " change(s) queued";
      if (status.isMember("indexer")) {
        text += ", " + std::to_string(DocumentsWritten(status)) + " document(s) written";
      }
      if (terminal) {
        const int width = 40;
        const int filled = most == 0 ? width : static_cast<int>(width * (most - queued) / most);
        out.stream() << "\r[" << std::string(filled, '#') << std::string(width - filled, ' ')
                     << "] " << text << "   " << std::flush;
      } else if (text != last_text && (queued == 0 || now - last_line >= 5000000)) {
        out.stream() << text << '\n' << std::flush;
        last_text = text;
        last_line = now;
      }
    }
    if (queued == 0) {
      if (!out.json()) out.stream() << (terminal ? "\n" : "") << "indexing is idle\n";
      out.Emit(status, [](std::ostream&) {});
      return;
    }
    if (timeout > 0 && now - start > timeout * 1000000) {
      if (terminal) out.stream() << '\n';
      throw Error(kErrSystem, "still " + std::to_string(queued) + " change(s) queued after " +
                                  std::to_string(timeout) + " s");
    }
    Env::Current()->SleepMicros(500000);
  }
}

void DoctorCmd(const Args&, Output& out) {
  const Json::Value diagnosis = Diagnose();
  out.Emit(diagnosis, [&diagnosis](std::ostream& os) { PrintDiagnosis(diagnosis, os); });
  if (!diagnosis["ok"].asBool()) throw ExitWith{1};
}

}  // namespace

bool DaemonExchange(const std::string& socket, const std::string& payload, Json::Value& reply,
                    std::string& error) {
  return Exchange(socket, payload, reply, error);
}

Json::Value DaemonStateOf(const std::string& name) { return DaemonState(name); }

Json::Value StatusReport() { return CollectStatus(); }

// Prints, or writes into an smb.conf, the lines that send a share's Spotlight searches to the
// search gateway.
void ShareSpotlightCmd(const Args& args, Output& out) {
  SpotlightSettings s;
  s.share = args.At(0, "SHARE");
  s.address = args.Get("address", s.address);
  s.mappings = args.Get("mappings", s.mappings);
  const long long port = args.GetInt("port", s.port);
  if (port < 1 || port > 65535) throw UsageError("--port takes a port number (1 to 65535)");
  s.port = static_cast<int>(port);
  if (args.Has("write")) {
    const std::string path = args.Get("write");
    WriteSpotlightConf(path, s);
    out.Done("wrote the Spotlight settings of share " + s.share + " into " + path +
             "; reload the file server's configuration (smbcontrol smbd reload-config)");
    return;
  }
  Json::Value value(Json::objectValue);
  for (const auto& kv : SpotlightGlobalLines(s)) value["global"][kv.first] = kv.second;
  for (const auto& kv : SpotlightShareLines(s)) value["share"][kv.first] = kv.second;
  out.Emit(value, [&](std::ostream& o) { o << SpotlightConfText(s); });
}

const std::vector<Command>& Commands() {
  static const std::vector<Command> commands = {
      {"folder",
       "add",
       "PATH... [--name NAME] [--document on|off] [--audio on|off] "
       "[--video on|off] [--photo on|off] [--group GROUP] [--owner USER]",
       "index folders (documents by default; names and attributes always)",
       {"name", "document", "audio", "video", "photo", "group", "owner"},
       {},
       1000,
       FolderAddCmd},
      {"folder",
       "set",
       "PATH [--name NAME] [--document on|off] [--audio on|off] "
       "[--video on|off] [--photo on|off] [--group GROUP]",
       "change an indexed folder's settings",
       {"name", "document", "audio", "video", "photo", "group", "owner"},
       {},
       1,
       FolderSetCmd},
      {"folder",
       "delete",
       "PATH...",
       "stop indexing folders and drop their documents",
       {},
       {},
       1000,
       FolderDeleteCmd},
      {"folder",
       "list",
       "[--keyword TEXT] [--group GROUP] [--sort name|path] [--desc] "
       "[--offset N] [--limit N]",
       "list indexed folders with their status",
       {"keyword", "group", "sort", "offset", "limit"},
       {"desc"},
       0,
       FolderListCmd},
      {"folder", "get", "PATH", "show one indexed folder", {}, {}, 1, FolderGetCmd},
      {"folder",
       "reindex",
       "PATH...",
       "index folders again from scratch",
       {},
       {},
       1000,
       FolderReindexCmd},
      {"folder",
       "check",
       "PATH [--timeout SECONDS]",
       "compare a folder with the index, fix the differences and report them",
       {"timeout"},
       {},
       1,
       FolderCheckCmd},
      {"folder", "groups", "", "list the groups folders are shown to", {}, {}, 0, FolderGroupsCmd},
      TwoArgs("share", "rename", "FROM", "TO", "follow a share's new name", ShareRename,
              "renamed share"),
      OneArg("share", "pause", "SHARE", "stop indexing a share", SharePause, "paused share"),
      OneArg("share", "resume", "SHARE", "index a paused share again", ShareResume,
             "resumed share"),
      OneArg("share", "rebuild", "SHARE", "rebuild a share's index from scratch", ShareRebuild,
             "rebuilding share"),
      TwoArgs("share", "clear-paused", "SHARE", "SHARE_PATH", "drop a paused share's index data",
              ShareClearPaused, "cleared"),
      OneArg("share", "auto-clean", "SHARE", "drop the folders of a share that is gone",
             ShareAutoClean, "cleaned share"),
      OneArg("share", "check-recycle", "SHARE", "apply the recycle-bin rules to a share again",
             ShareCheckRecycle, "re-checking recycle bin of"),
      TwoArgs("share", "migrate", "SHARE", "FROM_PATH", "follow a share moved to another volume",
              ShareMigrate, "migrated"),
      {"share",
       "spotlight",
       "SHARE [--address IP] [--port N] [--mappings PATH] [--write SMB_CONF]",
       "print (or write into smb.conf) the lines that send a share's Spotlight searches to the "
       "search gateway",
       {"address", "port", "mappings", "write"},
       {},
       1,
       ShareSpotlightCmd},
      OneArg("volume", "pause", "VOLUME", "stop indexing every share on a volume", VolumePause,
             "paused volume"),
      OneArg("volume", "resume", "VOLUME", "index a volume's shares again", VolumeResume,
             "resumed volume"),
      OneArg("volume", "clear-paused", "VOLUME", "drop the index data of a paused volume",
             VolumeClearPaused, "cleared volume"),
      TwoArgs("user", "rename", "FROM", "TO", "follow a user's new name", UserRename,
              "renamed user"),
      UserHome("delete", "drop the indexed folders of a deleted user's home", UserDelete,
               "removed the home folders of user"),
      UserHome("remember", "record a user's home for a later delete", UserRemember,
               "remembered the home of user"),
      HomeService("enable", "the home service was switched on", HomeEnable),
      HomeService("disable", "the home service was switched off", HomeDisable),
      {"services",
       "prepare",
       "",
       "start or stop the services indexing depends on",
       {},
       {},
       0,
       ServicesPrepareCmd},
      {"",
       "pause",
       "[--hours N]",
       "pause all indexing (0 hours: until resumed)",
       {"hours"},
       {},
       0,
       PauseCmd},
      {"", "resume", "", "resume all indexing", {}, {}, 0, ResumeCmd},
      {"",
       "search",
       "[KEYWORDS...] [--name TEXT] [--folder PATH] [--ext EXT,...] "
       "[--type document|audio|video|photo|folder] [--min-size SIZE] "
       "[--max-size SIZE] [--after DATE] [--before DATE] "
       "[--sort relevance|name|size|mtime] [--desc] [--from N] [--size N] "
       "[--share SHARE] [--all-servers]",
       "search file names, contents and metadata",
       {"name", "folder", "ext", "type", "min-size", "max-size", "after", "before", "sort", "from",
        "size", "share"},
       {"desc", "all-servers"},
       1000,
       SearchCmd},
      {"",
       "suggest",
       "PREFIX [--size N]",
       "complete a word being typed",
       {"size"},
       {},
       1,
       SuggestCmd},
      {"",
       "status",
       "[--wait [--timeout SECONDS]]",
       "daemons, queues and folder status; --wait shows progress until indexing is idle",
       {"timeout"},
       {"wait"},
       0,
       StatusCmd},
      {"",
       "doctor",
       "",
       "what would stop indexing, each with what to do; exit status 1 when something does",
       {},
       {},
       0,
       DoctorCmd},
  };
  return commands;
}

}  // namespace ctl
}  // namespace orvane
