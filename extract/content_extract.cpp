#include "extract/content_extract.hpp"

#include <fcntl.h>
#include <sys/stat.h>

#include <cerrno>
#include <cstring>

#include <syslog.h>

#include "common/error.hpp"
#include "common/log.hpp"
#include "common/util.hpp"
#include "extract/extract_runner.hpp"

namespace QUIX {
namespace CONTENT_EXTRACT {

void ParseFile(const std::string& path, const Json::Value& config, Json::Value& doc) {
  struct statx st;
  std::memset(&st, 0, sizeof(st));
  ORVANE_THROW_IF(
      0 != statx(AT_FDCWD, path.c_str(), AT_SYMLINK_NOFOLLOW, STATX_BASIC_STATS | STATX_BTIME, &st),
      orvane::kErrSystem, "statx failed, path=" + path + ", reason=" + strerror(errno));

  Json::Value out(Json::objectValue);
  out[QUIXMDPath] = path;
  out[QUIXMDFSName] = orvane::Basename(path);
  out[QUIXMDParent] = orvane::Dirname(path);
  out[QUIXMDIsDir] = S_ISDIR(st.stx_mode);
  out[QUIXMDFSSize] = static_cast<Json::UInt64>(st.stx_size);
  out[QUIXMDFSContentChangeDate] = static_cast<Json::Int64>(st.stx_mtime.tv_sec);
  out[QUIXMDAttributeChangeDate] = static_cast<Json::Int64>(st.stx_ctime.tv_sec);
  // Not every file system records a birth time; a made-up one would mislead date searches.
  if (st.stx_mask & STATX_BTIME) {
    out[QUIXMDFSCreationDate] = static_cast<Json::Int64>(st.stx_btime.tv_sec);
  }
  out[QUIXMDOwnerUserID] = std::to_string(st.stx_uid);
  out[QUIXMDOwnerGroupID] = std::to_string(st.stx_gid);
  out[QUIXMDExtension] = orvane::GetFileExtension(path, true);
  // Contents are read by the helper process: a hostile file costs that process, not the indexer,
  // and a file whose contents cannot be read is still indexed by name and attributes. An empty
  // file has no contents: it costs no trip to the helper.
  if (S_ISREG(st.stx_mode) && st.stx_size > 0 && config.isObject() && config[kKeyNeedMeta].isBool() &&
      config[kKeyNeedMeta].asBool()) {
    Json::Value fields;
    std::string error;
    if (orvane::extract::RunExtractHelper(path, &fields, &error)) {
      for (const std::string& key : fields.getMemberNames()) {
        if (!out.isMember(key)) out[key] = fields[key];
      }
    } else {
      ORVANE_LOG(LOG_WARNING, "content of %s not extracted: %s", path.c_str(), error.c_str());
    }
  }
  doc.swap(out);
}

}  // namespace CONTENT_EXTRACT
}  // namespace QUIX
