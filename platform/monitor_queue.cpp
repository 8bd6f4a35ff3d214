#include "platform/monitor_queue.hpp"

#include <dirent.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdio>

#include "common/json_util.hpp"
#include "common/root.hpp"
#include "platform/fault.hpp"

namespace QUIX {
namespace QUIXNOTIFYD {

const char kRegistrationDir[] = "/var/lib/quixnotifyd/queues";

namespace {

bool IsAbsoluteString(const Json::Value& v) {
  return v.isString() && !v.asString().empty() && v.asString()[0] == '/';
}

bool IsValidRecord(const Json::Value& record) {
  if (!record.isObject() || !IsAbsoluteString(record["queue"]) || !record["config"].isArray()) {
    return false;
  }
  for (const Json::Value& entry : record["config"]) {
    if (!entry.isObject() || !IsAbsoluteString(entry["path"]) || !entry["mask"].isUInt() ||
        !entry["ignore"].isArray()) {
      return false;
    }
    for (const Json::Value& name : entry["ignore"]) {
      if (!name.isString()) return false;
    }
  }
  return true;
}

bool IsValidApp(const std::string& app) {
  return !app.empty() && app.size() <= 64 && std::all_of(app.begin(), app.end(), [](char c) {
    return (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || (c >= '0' && c <= '9') || c == '_' ||
           c == '-';
  });
}

// FNV-1a: stable across runs and builds, unlike std::hash.
std::string RegistrationPath(const std::string& queue_path, const std::string& app,
                             MonitorQueueType type) {
  uint64_t hash = 14695981039346656037ULL;
  for (unsigned char c : queue_path) {
    hash ^= c;
    hash *= 1099511628211ULL;
  }
  char name[128];
  std::snprintf(name, sizeof(name), "/%s.%d.%016llx.json", app.c_str(), static_cast<int>(type),
                static_cast<unsigned long long>(hash));
  return orvane::RootedPath(kRegistrationDir) + name;
}

}  // namespace

bool MonitorQueue::Upsert(const Json::Value& record, const std::string& app,
                          MonitorQueueType type) {
  if (auto fault = orvane::platform::FaultFor("MonitorQueue::Upsert")) {
    errno = fault->err;
    return false;
  }
  if (!IsValidRecord(record) || !IsValidApp(app)) {
    errno = EINVAL;
    return false;
  }
  orvane::JsonValue stored(record);
  stored["app"] = app;
  stored["type"] = static_cast<int>(type);
  return stored.toFile(RegistrationPath(record["queue"].asString(), app, type));
}

bool MonitorQueue::Delete(const std::string& queue_path, const std::string& app,
                          MonitorQueueType type) {
  if (auto fault = orvane::platform::FaultFor("MonitorQueue::Delete")) {
    errno = fault->err;
    return false;
  }
  if (!IsValidApp(app)) {
    errno = EINVAL;
    return false;
  }
  // A registration already gone counts as deleted.
  const std::string path = RegistrationPath(queue_path, app, type);
  return unlink(path.c_str()) == 0 || errno == ENOENT;
}

std::vector<Json::Value> MonitorQueue::List() {
  std::vector<std::string> names;
  const std::string dir = orvane::RootedPath(kRegistrationDir);
  if (DIR* d = opendir(dir.c_str())) {
    while (struct dirent* entry = readdir(d)) {
      const std::string name = entry->d_name;
      if (name.size() > 5 && name.compare(name.size() - 5, 5, ".json") == 0) {
        names.push_back(name);
      }
    }
    closedir(d);
  }
  std::sort(names.begin(), names.end());
  std::vector<Json::Value> records;
  for (const std::string& name : names) {
    orvane::JsonValue record;
    if (record.fromFile(dir + "/" + name) && IsValidRecord(record)) records.push_back(record);
  }
  return records;
}

}  // namespace QUIXNOTIFYD
}  // namespace QUIX
