// The content-extraction interface: the metadata vocabulary of index documents and ParseFile,
// which turns one file or directory into the fields of its document: the file-system fields from
// statx(2), the content and media fields from an extraction helper process (extract_runner).
// Keeps no state of its own; safe from any thread.
#ifndef ORVANE_EXTRACT_CONTENT_EXTRACT_HPP_
#define ORVANE_EXTRACT_CONTENT_EXTRACT_HPP_

#include <json/json.h>

#include <string>

namespace QUIX {
namespace CONTENT_EXTRACT {

// The extraction service and its request record.
constexpr char kPidPath[] = "/var/run/quixcontentextractd.pid";
constexpr char kShmPath[] = "/tmp/quixce_shm";
constexpr char kServiceName[] = "quixcontentextractd";
constexpr char kKeyCfg[] = "cfg";
constexpr char kKeyPath[] = "path";
constexpr char kKeyPseudoPath[] = "pseudo_path";
constexpr char kKeyCodepage[] = "codepage";
// The extraction configuration's one member: extract content and media metadata too.
constexpr char kKeyNeedMeta[] = "need_meta";

// Document fields.
constexpr char QUIXMDPath[] = "QUIXMDPath";
constexpr char QUIXMDFSName[] = "QUIXMDFSName";
constexpr char QUIXMDParent[] = "QUIXMDParent";
constexpr char QUIXMDIsDir[] = "QUIXMDIsDir";
constexpr char QUIXMDFSSize[] = "QUIXMDFSSize";
constexpr char QUIXMDFSContentChangeDate[] = "QUIXMDFSContentChangeDate";
constexpr char QUIXMDAttributeChangeDate[] = "QUIXMDAttributeChangeDate";
constexpr char QUIXMDFSCreationDate[] = "QUIXMDFSCreationDate";
constexpr char QUIXMDOwnerUserID[] = "QUIXMDOwnerUserID";
constexpr char QUIXMDOwnerGroupID[] = "QUIXMDOwnerGroupID";
constexpr char QUIXMDExtension[] = "QUIXMDExtension";
constexpr char QUIXMDDisplayName[] = "QUIXMDDisplayName";
constexpr char QUIXMDKind[] = "QUIXMDKind";
constexpr char QUIXMDSearchFileName[] = "QUIXMDSearchFileName";
constexpr char QUIXMDSearchAncestor[] = "QUIXMDSearchAncestor";

// Fills `doc` (replacing what it held) with the document fields of `path`, a full path: the path,
// its name and parent, whether it is a directory, its size, its content-change, attribute-change
// and creation times (seconds since the epoch; the creation time only where the file system
// records one), its owner's user and group ids (as text) and its lower-cased extension. A
// symbolic link is described as itself. With "need_meta" true in `config`, a regular file's
// contents and media fields are added by the extraction helper; when that fails the file keeps
// its file-system fields, the failure is logged and counted (ExtractFailureCount()).
// Throws orvane::Error 502 when the path cannot be stat'ed.
void ParseFile(const std::string& path, const Json::Value& config, Json::Value& doc);

}  // namespace CONTENT_EXTRACT
}  // namespace QUIX

#endif  // ORVANE_EXTRACT_CONTENT_EXTRACT_HPP_
