// The compact form in which the indexer sends the engine the name-and-attribute documents of a
// crawl: one "document_bulk_upsert" command carries thousands of them as one string, each a
// short record under the folder it sits in, so neither side builds or parses a JSON object per
// file. BulkEncoder writes it (owned by one crawl, not thread-safe); DecodeBulk reads it back to
// the very document the JSON command of the same file would have carried. No shared state.
#ifndef ORVANE_DAEMONS_QUIXELASTICD_BULK_CODEC_HPP_
#define ORVANE_DAEMONS_QUIXELASTICD_BULK_CODEC_HPP_

#include <json/json.h>
#include <sys/stat.h>

#include <cstddef>
#include <cstdint>
#include <functional>
#include <string>

namespace orvane {
namespace elasticd {

// {"command": kBulkUpsertCommand, "data": {"id": INDEX, "docs": TEXT}}; the reply's data is
// {"upserted": N}.
constexpr char kBulkUpsertCommand[] = "document_bulk_upsert";

// One file or folder as the file system describes it, named by its folder and its own name.
struct BulkDoc {
  std::string parent;
  std::string name;
  bool is_dir = false;
  uint64_t size = 0;
  int64_t mtime = 0;
  int64_t ctime = 0;
  bool has_btime = false;  // not every file system records a birth time
  int64_t btime = 0;
  uint32_t uid = 0;
  uint32_t gid = 0;

  std::string Path() const { return parent + "/" + name; }
  // The document's fields, member for member those of the JSON upsert of the same file: its
  // path, name, parent, type, size, times, owner ids (as text), lower-cased extension and the
  // two search fields filled from its name and parent.
  Json::Value ToJson() const;
};

class BulkEncoder {
 public:
  // Adds the document of `path` described by `st` (statx with STATX_BASIC_STATS | STATX_BTIME).
  // False, adding nothing, for a path that is not a folder and a name joined by "/" (a relative
  // one): such a document goes the JSON way.
  bool Add(const std::string& path, const struct statx& st);
  size_t count() const { return count_; }
  size_t bytes() const { return text_.size(); }
  // The text so far; the encoder starts afresh.
  std::string Take();

 private:
  std::string text_;
  std::string parent_;  // the folder the last record named
  size_t count_ = 0;
};

// Calls `fn` with each document of `text`, in order. A text that is not the encoder's (cut
// short, a bad number, a record of an unknown kind) stops at the first fault: false, with
// `error` saying where and what, after the documents before it were given to `fn`.
bool DecodeBulk(const std::string& text, const std::function<void(const BulkDoc&)>& fn,
                std::string* error);

}  // namespace elasticd
}  // namespace orvane

#endif  // ORVANE_DAEMONS_QUIXELASTICD_BULK_CODEC_HPP_
