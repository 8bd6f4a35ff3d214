#include "platform/config.hpp"

#include <json/json.h>
#include <sys/stat.h>
#include <syslog.h>

#include <cerrno>
#include <cstring>
#include <fstream>
#include <mutex>
#include <set>
#include <sstream>

#include "common/error.hpp"
#include "common/json_util.hpp"
#include "common/log.hpp"
#include "common/root.hpp"
#include "platform/platform_error.hpp"
#include "platform/smb_conf.hpp"

namespace orvane {
namespace platform {
namespace {

constexpr size_t kMaxShareNameBytes = 491;  // the share record's name field holds 492 bytes
constexpr size_t kMaxSharePathBytes = 4095;
constexpr char kDefaultSambaConf[] = "/etc/samba/smb.conf";

[[noreturn]] void Fail(const std::string& file, const std::string& fault) {
  throw Error(kErrLoadConfig, file + ": " + fault);
}

std::string Quoted(const std::string& s) { return "\"" + s + "\""; }

bool ReadBool(const Json::Value& obj, const char* key, const std::string& where,
              const std::string& file) {
  if (!obj.isMember(key)) return false;
  if (!obj[key].isBool()) Fail(file, where + ": " + Quoted(key) + " is not true or false");
  return obj[key].asBool();
}

int AccessCode(const Json::Value& v, const std::string& where, const std::string& file) {
  const std::string text = v.isString() ? v.asString() : std::string();
  if (text == "rw") return SHARE_READWRITE;
  if (text == "ro") return SHARE_READONLY;
  if (text == "na") return SHARE_NOACCESS;
  Fail(file, where + ": access must be \"rw\", \"ro\" or \"na\"");
}

void ReadAccessMap(const Json::Value& access, const char* key, std::map<std::string, int>* out,
                   const std::string& where, const std::string& file) {
  if (!access.isMember(key)) return;
  const Json::Value& map = access[key];
  if (!map.isObject()) Fail(file, where + ": \"access\"." + key + " is not an object");
  for (const std::string& name : map.getMemberNames()) {
    (*out)[name] = AccessCode(map[name], where + ": " + key + " " + Quoted(name), file);
  }
}

// A share path must be what realpath would print for it, so that prefix tests on full paths
// and the canonical-form rule agree with it.
bool IsCleanAbsolutePath(const std::string& path) {
  if (path.size() < 2 || path[0] != '/' || path.back() == '/') return false;
  size_t start = 1;
  while (start <= path.size()) {
    size_t end = path.find('/', start);
    if (end == std::string::npos) end = path.size();
    const std::string part = path.substr(start, end - start);
    if (part.empty() || part == "." || part == "..") return false;
    start = end + 1;
  }
  return true;
}

std::vector<std::string> ReadArgv(const Json::Value& v, const std::string& where,
                                  const std::string& file) {
  std::vector<std::string> argv;
  if (v.isNull()) return argv;
  if (!v.isArray() || v.empty()) Fail(file, where + " is not a non-empty array of strings");
  for (const Json::Value& arg : v) {
    if (!arg.isString()) Fail(file, where + " is not a non-empty array of strings");
    argv.push_back(arg.asString());
  }
  return argv;
}

ShareConfig ReadShare(const Json::Value& obj, size_t index, const std::string& file) {
  const std::string where = "share #" + std::to_string(index + 1);
  if (!obj.isObject()) Fail(file, where + " is not an object");
  ShareConfig share;
  if (!obj.isMember("name")) Fail(file, where + " has no \"name\"");
  if (!obj["name"].isString()) Fail(file, where + ": \"name\" is not a string");
  share.name = obj["name"].asString();
  if (share.name.empty() || share.name == "." || share.name == ".." ||
      share.name.find('/') != std::string::npos || share.name.find('\0') != std::string::npos ||
      share.name.size() > kMaxShareNameBytes) {
    Fail(file, where + ": invalid share name " + Quoted(share.name));
  }
  const std::string named = "share " + Quoted(share.name);
  if (!obj.isMember("path")) Fail(file, named + " has no \"path\"");
  if (!obj["path"].isString()) Fail(file, named + ": \"path\" is not a string");
  share.path = obj["path"].asString();
  if (share.path.size() > kMaxSharePathBytes || share.path.find('\0') != std::string::npos ||
      !IsCleanAbsolutePath(share.path)) {
    Fail(file, named + ": \"path\" " + Quoted(share.path) +
                   " is not a clean absolute path (no \".\", \"..\", \"//\" or trailing \"/\")");
  }
  if (share.path.substr(share.path.rfind('/') + 1) != share.name) {
    Fail(file, named + ": the last component of \"path\" " + Quoted(share.path) +
                   " is not the share name");
  }
  share.readonly = ReadBool(obj, "readonly", named, file);
  share.encrypted = ReadBool(obj, "encrypted", named, file);
  share.encryption = ReadBool(obj, "encryption", named, file);
  share.recycle_bin = ReadBool(obj, "recycle_bin", named, file);
  share.hide_unreadable = ReadBool(obj, "hide_unreadable", named, file);
  if (obj.isMember("ftp_privilege")) {
    if (!obj["ftp_privilege"].isInt()) Fail(file, named + ": \"ftp_privilege\" is not an integer");
    share.ftp_privilege = obj["ftp_privilege"].asInt();
  }
  if (obj.isMember("access")) {
    const Json::Value& access = obj["access"];
    if (!access.isObject()) Fail(file, named + ": \"access\" is not an object");
    ReadAccessMap(access, "users", &share.user_access, named, file);
    ReadAccessMap(access, "groups", &share.group_access, named, file);
  }
  return share;
}

// What a configuration file looked like when it was read; a file that did not exist is recorded
// too, so that creating it is a change.
struct FileIdentity {
  std::string path;
  int err = 0;  // errno of the stat, 0 when it succeeded
  dev_t dev = 0;
  ino_t ino = 0;
  mode_t mode = 0;
  off_t size = -1;
  struct timespec mtime = {0, 0};
  struct timespec ctime = {0, 0};

  bool operator==(const FileIdentity& o) const {
    return path == o.path && err == o.err && dev == o.dev && ino == o.ino && size == o.size &&
           mtime.tv_sec == o.mtime.tv_sec && mtime.tv_nsec == o.mtime.tv_nsec &&
           ctime.tv_sec == o.ctime.tv_sec && ctime.tv_nsec == o.ctime.tv_nsec;
  }
};

FileIdentity IdentityOf(const std::string& path) {
  FileIdentity identity;
  identity.path = path;
  struct stat st;
  if (stat(path.c_str(), &st) != 0) {
    identity.err = errno;
    return identity;
  }
  identity.dev = st.st_dev;
  identity.ino = st.st_ino;
  identity.mode = st.st_mode;
  identity.size = st.st_size;
  identity.mtime = st.st_mtim;
  identity.ctime = st.st_ctim;
  return identity;
}

struct Cache {
  std::mutex mu;
  std::vector<FileIdentity> identities;  // every file the cached value was read from
  std::shared_ptr<const PlatformConfig> config;
};

thread_local std::shared_ptr<const PlatformConfig> t_pinned;

Cache& GetCache() {
  static Cache* cache = new Cache();  // outlives every static destructor that may still log
  return *cache;
}

}  // namespace

const ShareConfig* PlatformConfig::FindShare(const std::string& name) const {
  for (const ShareConfig& share : shares) {
    if (share.name == name) return &share;
  }
  return nullptr;
}

std::string PlatformConfigPath() { return RootedPath("/etc/orvane/platform.json"); }

std::string PlatformKeysPath() { return RootedPath("/etc/orvane/fileindex.conf"); }

std::shared_ptr<const PlatformConfig> ParsePlatformConfig(const std::string& text,
                                                          const std::string& file) {
  Json::Value root;
  std::string errs;
  if (!JsonParseChecked(text, &root, &errs)) {
    Fail(file, "malformed JSON: " + errs.substr(0, errs.find_last_not_of("\n") + 1));
  }
  if (!root.isObject()) Fail(file, "the top level is not a JSON object");

  auto config = std::make_shared<PlatformConfig>();
  config->source = file;
  config->samba_conf = RootedPath(kDefaultSambaConf);
  if (root.isMember("shares")) {
    const Json::Value& shares = root["shares"];
    if (!shares.isArray()) Fail(file, "\"shares\" is not an array");
    std::set<std::string> names;
    for (Json::ArrayIndex i = 0; i < shares.size(); ++i) {
      ShareConfig share = ReadShare(shares[i], i, file);
      if (!names.insert(share.name).second) {
        Fail(file, "two shares are named " + Quoted(share.name));
      }
      config->shares.push_back(std::move(share));
    }
  }
  if (root.isMember("admin_group")) {
    if (!root["admin_group"].isString() || root["admin_group"].asString().empty()) {
      Fail(file, "\"admin_group\" is not a non-empty string");
    }
    config->admin_group = root["admin_group"].asString();
  }
  if (root.isMember("samba_conf")) {
    if (!root["samba_conf"].isString()) Fail(file, "\"samba_conf\" is not a string");
    config->samba_conf = root["samba_conf"].asString();
  }
  if (root.isMember("services")) {
    const Json::Value& services = root["services"];
    if (!services.isObject()) Fail(file, "\"services\" is not an object");
    for (const std::string& name : services.getMemberNames()) {
      const Json::Value& svc = services[name];
      const std::string where = "service " + Quoted(name);
      if (!svc.isObject()) Fail(file, where + " is not an object");
      ServiceCommands commands;
      commands.start = ReadArgv(svc["start"], where + ": \"start\"", file);
      commands.stop = ReadArgv(svc["stop"], where + ": \"stop\"", file);
      commands.restart = ReadArgv(svc["restart"], where + ": \"restart\"", file);
      config->services[name] = std::move(commands);
    }
  }
  return config;
}

namespace {

// The keys file: "name = value" lines, '#' or ';' comments.
void ReadKeys(const std::string& file, PlatformConfig* config) {
  const SmbConf keys = ReadSmbConf(file, /*follow_includes=*/false);
  if (!keys.sections.empty()) {
    Fail(keys.sections[0].where, "this file has no [sections]; write \"key = value\" lines");
  }
  for (const auto& [key, value] : keys.global.params) {
    if (key == "admin_group" && !value.text.empty()) {
      config->admin_group = value.text;
    } else if (key == "samba_conf" && !value.text.empty() && value.text[0] == '/') {
      config->samba_conf = value.text;
    } else if (key == "admin_group" || key == "samba_conf") {
      Fail(value.where, Quoted(key) + " needs " +
                            (key == "admin_group" ? "a group name" : "an absolute path"));
    } else {
      Fail(value.where, "unknown key " + Quoted(key) +
                            "; the keys are admin_group and samba_conf");
    }
  }
}

// The configuration of a server without platform.json: the shares that Samba exports.
std::shared_ptr<const PlatformConfig> LoadFromSamba(std::vector<FileIdentity>* identities) {
  auto config = std::make_shared<PlatformConfig>();
  config->samba_conf = RootedPath(kDefaultSambaConf);
  const std::string keys_file = PlatformKeysPath();
  identities->push_back(IdentityOf(keys_file));
  if (identities->back().err == 0) ReadKeys(keys_file, config.get());

  identities->push_back(IdentityOf(config->samba_conf));
  if (identities->back().err != 0) {
    Fail(config->samba_conf, std::string("cannot be read: ") + strerror(identities->back().err) +
                                 "; without it or " + PlatformConfigPath() +
                                 " no shares are known: configure Samba's shares, set "
                                 "samba_conf in " + keys_file + ", or list the shares in " +
                                 PlatformConfigPath());
  }
  const SmbConf smb = ReadSmbConf(config->samba_conf);
  // Included files are known only once read; a change made to one in between is seen at its
  // next change.
  for (size_t i = 1; i < smb.files.size(); ++i) identities->push_back(IdentityOf(smb.files[i]));
  SharesFromSmbConf(smb, &config->shares, &config->skipped);
  config->source = config->samba_conf;
  for (const std::string& note : config->skipped) {
    Log(LOG_WARNING, "not indexed: %s", note.c_str());
  }
  return config;
}

bool Unchanged(const std::vector<FileIdentity>& identities) {
  for (const FileIdentity& identity : identities) {
    if (!(IdentityOf(identity.path) == identity)) return false;
  }
  return true;
}

}  // namespace

std::shared_ptr<const PlatformConfig> LoadPlatformConfig() {
  Cache& cache = GetCache();
  {
    std::lock_guard<std::mutex> lock(cache.mu);
    if (cache.config && Unchanged(cache.identities)) return cache.config;
  }
  const std::string file = PlatformConfigPath();
  std::vector<FileIdentity> identities = {IdentityOf(file)};
  std::shared_ptr<const PlatformConfig> config;
  if (identities[0].err == ENOENT) {
    config = LoadFromSamba(&identities);
  } else {
    if (identities[0].err != 0) {
      Fail(file, std::string("cannot be read: ") + strerror(identities[0].err));
    }
    if (!S_ISREG(identities[0].mode)) Fail(file, "cannot be read: not a regular file");
    std::ifstream in(file, std::ios::binary);
    if (!in) Fail(file, std::string("cannot be read: ") + strerror(errno));
    std::ostringstream text;
    text << in.rdbuf();
    if (in.bad()) Fail(file, "cannot be read: read error");
    config = ParsePlatformConfig(text.str(), file);
  }

  std::lock_guard<std::mutex> lock(cache.mu);
  cache.identities = std::move(identities);
  cache.config = config;
  return config;
}

std::shared_ptr<const PlatformConfig> ConfigForCall() {
  if (t_pinned) return t_pinned;
  try {
    return LoadPlatformConfig();
  } catch (const Error& e) {
    Log(LOG_ERR, "platform configuration unusable: %s", e.message.c_str());
    errno = EINVAL;
    QLIBCErrSet(kQErrConfig);
    return nullptr;
  }
}

ScopedConfigSnapshot::ScopedConfigSnapshot() : previous_(t_pinned) {
  if (t_pinned) return;
  try {
    t_pinned = LoadPlatformConfig();
  } catch (const Error&) {
    // Nothing pinned: each call meets the fault itself and reports it the platform way.
  }
}

ScopedConfigSnapshot::~ScopedConfigSnapshot() { t_pinned = previous_; }

}  // namespace platform
}  // namespace orvane
