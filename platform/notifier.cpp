#include "platform/notifier.hpp"

#include <fcntl.h>
#include <syslog.h>
#include <unistd.h>

#include <fstream>

#include "common/env.hpp"
#include "common/error.hpp"
#include "common/fd.hpp"
#include "common/json_util.hpp"
#include "common/log.hpp"
#include "common/root.hpp"

namespace orvane {
namespace platform {

Json::Value ParseNotification(const std::vector<std::string>& args) {
  Json::Value record(Json::objectValue);
  std::vector<std::string> positional;
  for (size_t i = 0; i < args.size(); ++i) {
    const std::string& arg = args[i];
    if (arg == "-c" || arg == "-b" || arg == "-e") {
      if (i + 1 >= args.size()) throw Error(kErrInvalidParam, "Missing value of " + arg);
      const std::string key = arg == "-c" ? "app" : arg == "-b" ? "b" : "e";
      record[key] = args[++i];
    } else {
      positional.push_back(arg);
    }
  }
  if (positional.size() < 3) {
    throw Error(kErrInvalidParam, "Expected recipients, a title and a message");
  }
  record["to"] = positional[0];
  record["title"] = positional[1];
  record["message"] = positional[2];
  record["args"] = Json::Value(Json::arrayValue);
  for (size_t i = 3; i < positional.size(); ++i) record["args"].append(positional[i]);
  return record;
}

bool AppendNotification(Json::Value notification) {
  notification["time"] = static_cast<Json::Int64>(Env::Current()->Now());
  const std::string line = JsonToString(notification) + "\n";
  Log(LOG_NOTICE, "notification: %s", line.substr(0, line.size() - 1).c_str());
  const std::string path = RootedPathForWrite(kNotificationsPath);
  UniqueFd fd(open(path.c_str(), O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0644));
  if (!fd.valid()) return false;
  // One write per line: appends of other processes land before or after it, never inside.
  const ssize_t n = write(fd.get(), line.data(), line.size());
  return n == static_cast<ssize_t>(line.size()) && fd.Close();
}

std::vector<Json::Value> ReadNotifications() {
  std::vector<Json::Value> records;
  std::ifstream in(RootedPath(kNotificationsPath));
  std::string line;
  while (std::getline(in, line)) {
    JsonValue value;
    if (value.fromString(line) && value.isObject()) records.push_back(value);
  }
  return records;
}

}  // namespace platform
}  // namespace orvane
