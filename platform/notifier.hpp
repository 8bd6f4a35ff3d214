// The desktop notifier of this platform: instead of a desktop it logs each notification and
// appends it as one JSON line to the notifications file, which the command-line tool shows. The
// program "usr/libexec/fileindex/quixzrmnotify" (under ORVANE_ROOT) is a thin main around these
// functions. Stateless; appends from several processes interleave whole lines.
#ifndef ORVANE_PLATFORM_NOTIFIER_HPP_
#define ORVANE_PLATFORM_NOTIFIER_HPP_

#include <json/json.h>

#include <string>
#include <vector>

namespace orvane {
namespace platform {

constexpr char kNotifierPath[] = "/usr/libexec/fileindex/quixzrmnotify";
constexpr char kNotificationsPath[] = "/var/packages/Orvane/var/notifications";

// The notifier's command line as a record: the options "-c" (the sending application), "-b" and
// "-e" (passed through as given), then the recipients ("@group" or user names), the title key,
// the message key and the message's arguments. Throws Error 120 for a line it cannot read.
Json::Value ParseNotification(const std::vector<std::string>& args);

// Adds `notification` with the current time to the notifications file (creating it and its
// folders) and logs it. False when the file cannot be written.
bool AppendNotification(Json::Value notification);

// Every notification in the file, oldest first; lines that are not JSON objects are skipped.
std::vector<Json::Value> ReadNotifications();

}  // namespace platform
}  // namespace orvane

#endif  // ORVANE_PLATFORM_NOTIFIER_HPP_
