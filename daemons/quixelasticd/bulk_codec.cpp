#include "daemons/quixelasticd/bulk_codec.hpp"

#include <charconv>

#include "common/util.hpp"
#include "extract/content_extract.hpp"

// The text is a run of records, each ended by a newline:
//   P<len>:<folder>                 the folder of the records that follow
//   F<len>:<name> SIZE MTIME CTIME BTIME UID GID   a file ("D" for a folder); BTIME "-" if none
// Names and folders are counted in bytes, so they may hold any byte, a newline included.

namespace orvane {
namespace elasticd {

namespace {

namespace ce = QUIX::CONTENT_EXTRACT;

template <typename T>
void AppendNumber(T value, std::string* out) {
  char buf[24];
  const auto res = std::to_chars(buf, buf + sizeof(buf), value);
  out->append(buf, res.ptr);
}

void AppendCounted(char kind, const char* bytes, size_t size, std::string* out) {
  out->push_back(kind);
  AppendNumber(size, out);
  out->push_back(':');
  out->append(bytes, size);
}

// Reads the text from one record to the next; every method fails rather than read past the end.
class Reader {
 public:
  explicit Reader(const std::string& text) : p_(text.data()), begin_(p_), end_(p_ + text.size()) {}

  bool done() const { return p_ == end_; }
  size_t offset() const { return static_cast<size_t>(p_ - begin_); }

  bool Char(char* c) {
    if (p_ == end_) return false;
    *c = *p_++;
    return true;
  }
  bool Expect(char c) {
    if (p_ == end_ || *p_ != c) return false;
    ++p_;
    return true;
  }
  template <typename T>
  bool Number(T* value) {
    const auto res = std::from_chars(p_, end_, *value);
    if (res.ec != std::errc() || res.ptr == p_) return false;
    p_ = res.ptr;
    return true;
  }
  bool Counted(std::string* out) {
    size_t size = 0;
    if (!Number(&size) || !Expect(':') || size > static_cast<size_t>(end_ - p_)) return false;
    out->assign(p_, size);
    p_ += size;
    return true;
  }

 private:
  const char* p_;
  const char* const begin_;
  const char* const end_;
};

bool ReadAttributes(Reader& in, BulkDoc* doc) {
  if (!in.Expect(' ') || !in.Number(&doc->size) || !in.Expect(' ') || !in.Number(&doc->mtime) ||
      !in.Expect(' ') || !in.Number(&doc->ctime) || !in.Expect(' ')) {
    return false;
  }
  doc->has_btime = !in.Expect('-');
  if (doc->has_btime && !in.Number(&doc->btime)) return false;
  return in.Expect(' ') && in.Number(&doc->uid) && in.Expect(' ') && in.Number(&doc->gid) &&
         in.Expect('\n');
}

}  // namespace

Json::Value BulkDoc::ToJson() const {
  Json::Value out(Json::objectValue);
  out[ce::QUIXMDPath] = Path();
  out[ce::QUIXMDFSName] = name;
  out[ce::QUIXMDParent] = parent;
  out[ce::QUIXMDIsDir] = is_dir;
  out[ce::QUIXMDFSSize] = static_cast<Json::UInt64>(size);
  out[ce::QUIXMDFSContentChangeDate] = static_cast<Json::Int64>(mtime);
  out[ce::QUIXMDAttributeChangeDate] = static_cast<Json::Int64>(ctime);
  if (has_btime) out[ce::QUIXMDFSCreationDate] = static_cast<Json::Int64>(btime);
  out[ce::QUIXMDOwnerUserID] = std::to_string(uid);
  out[ce::QUIXMDOwnerGroupID] = std::to_string(gid);
  out[ce::QUIXMDExtension] = GetFileExtension(name, true);
  out[ce::QUIXMDSearchFileName] = name;
  out[ce::QUIXMDSearchAncestor] = parent;
  return out;
}

bool BulkEncoder::Add(const std::string& path, const struct statx& st) {
  const size_t slash = path.rfind('/');
  if (slash == std::string::npos) return false;
  if (parent_.size() != slash || path.compare(0, slash, parent_) != 0 || count_ == 0) {
    parent_.assign(path, 0, slash);
    AppendCounted('P', parent_.data(), parent_.size(), &text_);
    text_.push_back('\n');
  }
  AppendCounted(S_ISDIR(st.stx_mode) ? 'D' : 'F', path.data() + slash + 1,
                path.size() - slash - 1, &text_);
  text_.push_back(' ');
  AppendNumber(static_cast<uint64_t>(st.stx_size), &text_);
  text_.push_back(' ');
  AppendNumber(static_cast<int64_t>(st.stx_mtime.tv_sec), &text_);
  text_.push_back(' ');
  AppendNumber(static_cast<int64_t>(st.stx_ctime.tv_sec), &text_);
  text_.push_back(' ');
  if (st.stx_mask & STATX_BTIME) {
    AppendNumber(static_cast<int64_t>(st.stx_btime.tv_sec), &text_);
  } else {
    text_.push_back('-');
  }
  text_.push_back(' ');
  AppendNumber(st.stx_uid, &text_);
  text_.push_back(' ');
  AppendNumber(st.stx_gid, &text_);
  text_.push_back('\n');
  ++count_;
  return true;
}

std::string BulkEncoder::Take() {
  std::string out;
  out.swap(text_);
  count_ = 0;
  parent_.clear();
  return out;
}

bool DecodeBulk(const std::string& text, const std::function<void(const BulkDoc&)>& fn,
                std::string* error) {
  Reader in(text);
  BulkDoc doc;
  bool have_parent = false;
  size_t record = 0;
  while (!in.done()) {
    const size_t at = in.offset();
    char kind = 0;
    in.Char(&kind);
    bool ok = false;
    if (kind == 'P') {
      ok = in.Counted(&doc.parent) && in.Expect('\n');
      have_parent = ok;
    } else if (kind == 'F' || kind == 'D') {
      doc.is_dir = kind == 'D';
      ok = have_parent && in.Counted(&doc.name) && !doc.name.empty() &&
           doc.name.find('/') == std::string::npos && ReadAttributes(in, &doc);
    }
    if (!ok) {
      const char* why = kind != 'P' && kind != 'F' && kind != 'D' ? "of no known kind"
                        : kind != 'P' && !have_parent            ? "before any folder"
                                                                  : "malformed";
      *error = "bulk record " + std::to_string(record) + " at byte " + std::to_string(at) +
               " is " + why;
      return false;
    }
    if (kind != 'P') fn(doc);
    ++record;
  }
  return true;
}

}  // namespace elasticd
}  // namespace orvane
