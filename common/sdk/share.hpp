// SDKShare: one shared folder as the platform describes it (name, volume path, flags), with the
// share's index locations (queue file, database folder, index id), its space check and users'
// privileges. It owns the platform's share record for its lifetime. Not copyable; one object is
// meant for one thread (its lazily filled caches are not locked).
#ifndef ORVANE_COMMON_SDK_SHARE_HPP_
#define ORVANE_COMMON_SDK_SHARE_HPP_

#include <cstdint>
#include <map>
#include <memory>
#include <set>
#include <string>

#include "common/sdk/sdk_mutex.hpp"

namespace orvane {
namespace platform {
struct QUIXSHARE;
}  // namespace platform

namespace sdk {

class SDKShare {
 public:
  // Throws Error 800 (message: the share name) when the platform does not know the share.
  explicit SDKShare(const std::string& name);
  ~SDKShare();
  SDKShare(const SDKShare&) = delete;
  SDKShare& operator=(const SDKShare&) = delete;

  // Neither encrypted-and-locked nor read-only. Throws Error 502 when a flag cannot be read.
  bool CanBeIndexed() const;
  // An encrypted share (its root is a mount point while unlocked). Throws Error 502.
  bool IsEncryption() const;
  // Throws Error 502.
  bool IsEnableRecycleBin() const;
  // False also when the platform cannot tell.
  bool IsHideUnReadable() const;
  // False only when the platform reports a full volume or an exceeded quota for 100 MiB more.
  bool IsSpaceEnough() const;
  int GetFTPPrivilege() const;
  // The platform's privilege code of `user` (platform::SHARE_*; negative for an unknown user),
  // asked once per user and object.
  int GetPrivilege(const std::string& user) const;

  // Index locations; each asked of the platform once, then kept. Throw Error 502.
  const std::string& GetQueuePath() const;
  const std::string& GetDBPath() const;
  const std::string& GetDBName() const;

  // The share's name and its folder on the volume, as the platform record holds them.
  std::string GetName() const;
  std::string GetPath() const;

  // The names of every share. Throws Error 121 when they cannot be listed.
  static std::set<std::string> Enum();

 private:
  struct ShareFree {
    void operator()(platform::QUIXSHARE* share) const;
  };

  std::unique_ptr<platform::QUIXSHARE, ShareFree> share_info_;
  std::string share_name_;
  mutable std::map<std::string, int32_t> privileges_;
  mutable std::string queue_path_;
  mutable std::string db_path_;
  mutable std::string db_name_;
};

}  // namespace sdk
}  // namespace orvane

#endif  // ORVANE_COMMON_SDK_SHARE_HPP_
