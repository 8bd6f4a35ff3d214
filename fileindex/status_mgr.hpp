// StatusMgr holds the status file: the global pause of indexing and per-share status flags
// (bit 1: the share's index must be rebuilt; bit values of other owners are kept as they are).
// A short-lived value loaded when constructed; writers serialise on the status lock file, readers
// take no lock. Not thread-safe.
#ifndef ORVANE_FILEINDEX_STATUS_MGR_HPP_
#define ORVANE_FILEINDEX_STATUS_MGR_HPP_

#include <json/json.h>

#include <string>

namespace orvane {
namespace fileindex {

// Fixed paths, resolved through RootedPath() where opened.
extern const char kFileIndexStatusCfgPath[];
extern const char kStatusCfgLockPath[];

class StatusMgr {
 public:
  // Loads the status file; a missing file is no error, a malformed one throws Error 504.
  StatusMgr();
  StatusMgr(const StatusMgr&) = delete;
  StatusMgr& operator=(const StatusMgr&) = delete;

  // The flags of `share`, 0 when it has none. Throws Error 120 when the file has no "share"
  // object.
  int GetShareStatus(const std::string& share) const;
  // Adds `bits` to the flags of `share` and saves, under the status lock. Throws Error 120 when
  // the file has no "share" object, and the errors of Save().
  void SetShareStatus(const std::string& share, int bits);
  // Writes the file as root, mode 0644. Throws Error 505 (write) or 502 (chmod).
  void Save();

 private:
  Json::Value data_;
};

}  // namespace fileindex
}  // namespace orvane

#endif  // ORVANE_FILEINDEX_STATUS_MGR_HPP_
