// What every format's extractor is written against: the opened file, reading it, UTF-8 text under
// a budget, and setting fields. An extractor is one function from an opened file to the fields it
// adds; extract/content.cpp picks it from the file's kind. Used only inside the extraction
// helper; nothing here keeps state between files, and every function is safe from any thread.
#ifndef ORVANE_EXTRACT_EXTRACTOR_HPP_
#define ORVANE_EXTRACT_EXTRACTOR_HPP_

#include <json/json.h>
#include <sys/types.h>

#include <cstddef>
#include <functional>
#include <map>
#include <string>

#include "common/fd.hpp"
#include "extract/content.hpp"

namespace orvane {
namespace extract {

// Archives in archives are opened this many levels down; deeper ones give their names only.
constexpr int kMaxNestingDepth = 3;

[[noreturn]] void Fail(const std::string& what);

// The file being extracted, opened once. Every library reads this descriptor or its
// /proc/self/fd name, which reaches the same inode, so a name swapped for something else after
// the open changes nothing, and nothing here ever blocks on a FIFO or follows a link.
// A member of an archive is an OpenedFile too: an in-memory file holding its bytes, named by the
// member's name and one level deeper than its container.
class OpenedFile {
 public:
  explicit OpenedFile(const std::string& path);
  // `fd` holds the member called `name` of a container at depth `depth - 1`.
  OpenedFile(UniqueFd fd, const std::string& name, int depth);

  int fd() const { return fd_.get(); }
  // A name the path-taking libraries open the same file by.
  const std::string& proc_path() const { return proc_path_; }
  // The path or member name: its extension is the one the kind decision looks at.
  const std::string& name() const { return name_; }
  // 0 for a file on disk, 1 for a member of it, and so on.
  int depth() const { return depth_; }
  off_t size() const { return size_; }

 private:
  void Stat();

  UniqueFd fd_;
  std::string proc_path_;
  std::string name_;
  int depth_ = 0;
  off_t size_ = 0;
};

// Up to `max_bytes` from the start, whatever the descriptor's offset, which the type sniffing
// may move.
std::string ReadPrefix(const OpenedFile& file, size_t max_bytes);

// Length of the UTF-8 sequence starting at s[i], or 0 when it is not a valid one.
size_t Utf8SequenceLength(const std::string& s, size_t i);

// Keeps the valid sequences of `s`, at most `max_bytes` of them.
std::string CleanUtf8(const std::string& s, size_t max_bytes);

// Collects text with a byte budget.
class TextSink {
 public:
  explicit TextSink(size_t max) : max_(max) {}
  void Add(const std::string& s) {
    if (!full()) text_ += s;
  }
  // Ends the current line, unless nothing or a line end came last.
  void Break() {
    if (!text_.empty() && text_.back() != '\n' && !full()) text_ += '\n';
  }
  bool full() const { return text_.size() >= max_; }
  bool at_line_start() const { return text_.empty() || text_.back() == '\n'; }
  size_t size() const { return text_.size(); }
  std::string Take() { return CleanUtf8(text_, max_); }

 private:
  size_t max_;
  std::string text_;
};

// Sets `key` to `value` trimmed and cleaned, unless that leaves nothing.
void SetText(Json::Value& fields, const std::string& key, const std::string& value);

// Reads a zip's members one after the other; `visit` gets the name and the first `max_bytes`
// bytes of each member `want` selects, and stops the walk by returning false.
void ForEachZipMember(const OpenedFile& file, size_t max_bytes,
                      const std::function<bool(const std::string&)>& want,
                      const std::function<bool(const std::string&, std::string&)>& visit);

// Reads the members of a zip file that `want` selects, in archive order.
std::map<std::string, std::string> ReadZipMembers(const OpenedFile& file,
                                                  bool (*want)(const std::string&));

// Walks one XML document: text goes to `sink` (when not null), and the text of the elements
// named in `props` (local names) goes to their fields, the first one of each winning.
void WalkXml(const std::string& xml, TextSink* sink,
             const std::map<std::string, std::string>& props, Json::Value& fields);

// Extracts `data`, the bytes of a member called `name` of a container `depth - 1` levels below the
// file on disk (an archive's member, a compressed file's contents, an attachment), as if it were
// a file of its own: an in-memory file whose kind is told as a file's is. Throws as extractors do.
void ExtractMember(const std::string& name, const std::string& data, int depth,
                   Json::Value& fields);

// Starts the budgets that every container inside one file on disk shares (bytes expanded, CPU
// time spent on members); called once per file on disk.
void StartExpansionBudget();

// The extractors, one per kind of file.
using Extractor = void (*)(const OpenedFile&, Json::Value&);
void ExtractText(const OpenedFile& file, Json::Value& fields);
void ExtractPdf(const OpenedFile& file, Json::Value& fields);
void ExtractOoxml(const OpenedFile& file, Json::Value& fields);
void ExtractOdf(const OpenedFile& file, Json::Value& fields);
void ExtractAudio(const OpenedFile& file, Json::Value& fields);
void ExtractPhoto(const OpenedFile& file, Json::Value& fields);
void ExtractVideo(const OpenedFile& file, Json::Value& fields);
// Archives (their member names and the texts of their members) and compressed single files
// (what they hold, extracted as its own kind).
void ExtractArchive(const OpenedFile& file, Json::Value& fields);

}  // namespace extract
}  // namespace orvane

#endif  // ORVANE_EXTRACT_EXTRACTOR_HPP_
