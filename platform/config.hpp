// The platform configuration: $ORVANE_ROOT/etc/orvane/platform.json (the shares, the
// administrators group, service commands and the Samba configuration path) or, without it, the
// shares that Samba exports and the keys of $ORVANE_ROOT/etc/orvane/fileindex.conf. Loaded and
// validated whole; the parsed value is cached and re-read when one of its files changes on
// disk. Values are immutable and shared; every function is safe from any thread.
#ifndef ORVANE_PLATFORM_CONFIG_HPP_
#define ORVANE_PLATFORM_CONFIG_HPP_

#include <map>
#include <memory>
#include <string>
#include <vector>

namespace orvane {
namespace platform {

// A share's privilege codes, as QUIXShareUserPrivCalc returns them (negative: the lookup failed).
constexpr int SHARE_NOACCESS = 0;
constexpr int SHARE_READONLY = 1;
constexpr int SHARE_READWRITE = 2;

struct ShareConfig {
  std::string name;
  std::string path;
  bool readonly = false;
  bool encrypted = false;   // an encrypted share that is locked
  bool encryption = false;  // an encrypted share; its root is a mount point when unlocked
  bool recycle_bin = false;
  bool hide_unreadable = false;
  int ftp_privilege = 0;
  // "access": {"users": {name: "rw"|"ro"|"na"}, "groups": {name: ...}}, as SHARE_* codes.
  std::map<std::string, int> user_access;
  std::map<std::string, int> group_access;
};

// Start, stop and restart commands of a service when systemd does not run: each an argument
// vector run without a shell.
struct ServiceCommands {
  std::vector<std::string> start;
  std::vector<std::string> stop;
  std::vector<std::string> restart;
};

struct PlatformConfig {
  std::vector<ShareConfig> shares;
  std::string admin_group = "administrators";
  std::map<std::string, ServiceCommands> services;
  std::string samba_conf;  // RootedPath("/etc/samba/smb.conf") unless configured
  // Where the shares came from: platform.json or Samba's configuration file.
  std::string source;
  // Samba's shares that cannot be indexed, each "file:line: share [name] ...why".
  std::vector<std::string> skipped;

  const ShareConfig* FindShare(const std::string& name) const;
};

// RootedPath("/etc/orvane/platform.json").
std::string PlatformConfigPath();
// RootedPath("/etc/orvane/fileindex.conf"): "admin_group = ..." and "samba_conf = ..." lines,
// read when platform.json is absent.
std::string PlatformKeysPath();

// The configuration in force. Throws Error 504 naming the file (and line) and the fault when a
// file is unreadable, malformed or inconsistent (a share without a name or path, two shares of
// one name, ...), or when neither platform.json nor Samba's configuration exists.
std::shared_ptr<const PlatformConfig> LoadPlatformConfig();

// Parses a configuration text; `file` only names the source in error messages. Throws as above.
std::shared_ptr<const PlatformConfig> ParsePlatformConfig(const std::string& text,
                                                          const std::string& file);

// For the platform calls: LoadPlatformConfig() turned into the platform's error convention.
// On failure the fault is logged once per call, errno is EINVAL, QLIBCErrGet() is kQErrConfig
// and the result is null.
std::shared_ptr<const PlatformConfig> ConfigForCall();

// Pins one view of the configuration for the platform calls that this thread makes during the
// scope, so that a judgement made of several calls sees one consistent configuration and the file
// is checked for changes once rather than on every call. Scopes nest; an unusable file pins
// nothing (each call then reports it as usual). Not copyable.
class ScopedConfigSnapshot {
 public:
  ScopedConfigSnapshot();
  ~ScopedConfigSnapshot();
  ScopedConfigSnapshot(const ScopedConfigSnapshot&) = delete;
  ScopedConfigSnapshot& operator=(const ScopedConfigSnapshot&) = delete;

 private:
  std::shared_ptr<const PlatformConfig> previous_;
};

}  // namespace platform
}  // namespace orvane

#endif  // ORVANE_PLATFORM_CONFIG_HPP_
