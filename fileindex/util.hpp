// Path rules and file kinds of the index. A share path is what the folder configuration and the
// index store ("/<share>/<rest>"); a full path is the path on the volume. These free functions
// convert between the two, take paths apart, decide whether a path may be indexed at all, and
// classify files by extension. Stateless apart from two tables built at load time and only read
// afterwards; safe from any thread.
#ifndef ORVANE_FILEINDEX_UTIL_HPP_
#define ORVANE_FILEINDEX_UTIL_HPP_

#include <cstdint>
#include <map>
#include <string>
#include <vector>

#include "common/util.hpp"

namespace orvane {
namespace fileindex {

using orvane::Basename;
using orvane::Dirname;
using orvane::GetFileExtension;
using orvane::StringStartWith;

// The share name of a share path: the text between the first "/" and the next one. Throws
// Error 120 (message: the path) when the path is empty or does not begin with "/".
void GetShareNameByPath(std::string& share_name, const std::string& share_path);
std::string GetShareNameByPath(const std::string& share_path);

// The full path of a share path: the share's folder on the volume with the share path's rest.
// Throws Error 800 for an unknown share, 120 for a malformed share path.
void GetFullPath(std::string& full_path, const std::string& share_path);
std::string GetFullPath(const std::string& share_path);

// The share holding a full path and that share's folder on the volume. Throws Error 502 when no
// share holds it.
void GetShareNamePathByFullPath(std::string& share_name, std::string& share_path,
                                const std::string& full_path);

// `path` with its share component `old_share` renamed to `new_share`. Throws Error 120
// "Cannot find share: <old_share>" when the path has no such component.
std::string ReplacePathShare(const std::string& path, const std::string& new_share,
                             const std::string& old_share);

// Whether a full path lies in a share's recycle bin or in a user's home recycle bin. Throws
// Error 502 when no share holds the path.
bool IsFullPathInRecycleBin(const std::string& full_path);

// Whether one name (not a path) is one of the platform's metadata folders or of the names that
// desktop systems and tools leave behind (".DS_Store", ".git", "Thumbs.db", ...).
bool IsSystemPreservedFileName(const std::string& name);

// Whether a full path may be indexed: not in a snapshot, on a local, non-image file system, in
// a share that can be indexed, not in a recycle bin, not a foreign mount point, free of
// preserved names, and already in canonical form. Throws (502, 800) when the path's share cannot
// be found or opened.
bool CanFullPathBeIndexed(const std::string& full_path);
// The same for a share path; the exceptions of GetFullPath pass through.
bool CanPathBeIndexed(const std::string& share_path);

enum FileType : int32_t {
  kDocument = 0,
  kAudio = 1,
  kVideo = 2,
  kPhoto = 3,
  kOther = 4,
};

// The kind of a file from its lower-cased extension; kOther for an extension not in the table.
// A name without an extension counts as a document. This table is the one decision of a file's
// kind: the folder switches, the crawl and the search filter by kind all ask it.
FileType GetFileTypeByFullPath(const std::string& full_path);
// The same for an extension already taken from a name and lower-cased ("" for none).
FileType GetFileTypeByExtension(const std::string& ext);

// Every extension of a kind, in byte order ("" among the documents); empty for kOther.
const std::vector<std::string>& GetExtensionsOfType(FileType type);

// The folder setting that switches extraction for a kind ("document", "audio", "video",
// "photo"); nullptr for kOther.
const char* GetFileTypeSetting(FileType type);
// The kind whose folder setting is `name`; kOther when `name` is none of the four.
FileType GetFileTypeBySetting(const std::string& name);

// The extension table itself (749 keys), for tools and tests.
const std::map<std::string, FileType>& FileTypeTable();

}  // namespace fileindex
}  // namespace orvane

#endif  // ORVANE_FILEINDEX_UTIL_HPP_
