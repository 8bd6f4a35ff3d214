#include <archive.h>
#include <archive_entry.h>
#include <unistd.h>

#include <algorithm>
#include <ctime>
#include <map>
#include <memory>
#include <string>

#include "common/util.hpp"
#include "extract/extractor.hpp"

namespace orvane {
namespace extract {
namespace {

// A container stops expanding once it has given out more than this many times what it has taken
// in, past a first allowance: texts shrink by a factor of ten or so, bombs by a thousand.
constexpr int64_t kMaxRatio = 100;
constexpr int64_t kRatioAllowance = 1 << 20;
// All the containers inside one file on disk together expand this much at most, members read
// and members passed over alike.
constexpr int64_t kMaxExpandedBytes = int64_t{512} << 20;
// CPU time for one file on disk: members' contents are read only in the first share of it, and
// an archive's names stop being listed at the end of it, so that a huge archive still gives
// what it has read before the helper's own limit ends the helper.
constexpr double kMemberCpuSeconds = 8;
constexpr double kArchiveCpuSeconds = 15;
// Headers read from one archive, at most.
constexpr int kMaxEntries = 100000;
// The members' names come first in the text and take at most this much of it.
constexpr size_t kMaxNamesBytes = 256 * 1024;

struct ExpansionBudget {
  int64_t expanded = 0;
  std::clock_t start = 0;
};
thread_local ExpansionBudget budget;

double CpuSeconds() { return static_cast<double>(std::clock() - budget.start) / CLOCKS_PER_SEC; }

using ArchivePtr = std::unique_ptr<struct archive, int (*)(struct archive*)>;

std::string ArchiveError(struct archive* a) {
  const char* text = archive_error_string(a);
  return text == nullptr ? "unknown error" : text;
}

ArchivePtr OpenArchive(const OpenedFile& file) {
  ArchivePtr a(archive_read_new(), archive_read_free);
  if (!a) Fail("out of memory");
  // Only the codecs built into the library: none of these runs an outside program.
  for (auto* support : {archive_read_support_filter_gzip, archive_read_support_filter_bzip2,
                        archive_read_support_filter_xz, archive_read_support_filter_lzma,
                        archive_read_support_filter_lzip, archive_read_support_filter_zstd,
                        archive_read_support_filter_lz4, archive_read_support_filter_compress}) {
    support(a.get());
  }
  // The raw format bids least: it takes a compressed stream that holds no archive.
  for (auto* support : {archive_read_support_format_tar, archive_read_support_format_zip,
                        archive_read_support_format_7zip, archive_read_support_format_rar,
                        archive_read_support_format_rar5, archive_read_support_format_cpio,
                        archive_read_support_format_ar, archive_read_support_format_raw}) {
    support(a.get());
  }
  if (lseek(file.fd(), 0, SEEK_SET) != 0 ||
      archive_read_open_fd(a.get(), file.fd(), 65536) != ARCHIVE_OK) {
    Fail("not a readable archive: " + ArchiveError(a.get()));
  }
  return a;
}

// Counts what one container expands and says when it must stop.
class ExpansionGuard {
 public:
  explicit ExpansionGuard(struct archive* a) : a_(a) {}

  void Count(size_t bytes) {
    out_ += static_cast<int64_t>(bytes);
    budget.expanded += static_cast<int64_t>(bytes);
  }
  bool Tripped() const {
    // What the codecs gave out counts too: headers, and members the format passed over.
    const int64_t out = std::max(out_, static_cast<int64_t>(archive_filter_bytes(a_, 0)));
    const int64_t in = archive_filter_bytes(a_, -1);
    return out > kMaxRatio * in + kRatioAllowance || budget.expanded > kMaxExpandedBytes ||
           CpuSeconds() > kArchiveCpuSeconds;
  }

 private:
  struct archive* a_;
  int64_t out_ = 0;
};

enum class Read { kWhole, kStopped, kDamaged };

// Reads the current member through to its end, keeping its first `max_bytes` in `*data` (nothing
// when null). kStopped: the guard ended it; kDamaged: the stream broke, and no later member can be
// read. Either way `*data` keeps what came before.
Read ReadMember(struct archive* a, ExpansionGuard* guard, size_t max_bytes, std::string* data) {
  for (;;) {
    const void* block;
    size_t size;
    la_int64_t offset;
    const int rc = archive_read_data_block(a, &block, &size, &offset);
    if (rc == ARCHIVE_EOF) return Read::kWhole;
    if (rc < ARCHIVE_WARN) return Read::kDamaged;
    guard->Count(size);
    if (data != nullptr && offset >= 0 && static_cast<uint64_t>(offset) < max_bytes) {
      // Sparse members come in pieces at their offsets; the holes read as zeros.
      const auto at = static_cast<size_t>(offset);
      const size_t keep = std::min(size, max_bytes - at);
      if (data->size() < at + keep) data->resize(at + keep);
      data->replace(at, keep, static_cast<const char*>(block), keep);
    }
    if (guard->Tripped()) return Read::kStopped;
  }
}

// What a compressed file holds is named by the file's name without the compression's extension.
std::string InnerName(const std::string& name) {
  static const std::map<std::string, std::string> kSuffixes = {
      {"gz", ""},      {"bz2", ""},      {"xz", ""},      {"zst", ""},     {"zstd", ""},
      {"lz4", ""},     {"lzma", ""},     {"lz", ""},      {"z", ""},       {"tgz", ".tar"},
      {"tbz", ".tar"}, {"tbz2", ".tar"}, {"txz", ".tar"}, {"tzst", ".tar"}};
  const std::string ext = GetFileExtension(name, true);
  auto it = kSuffixes.find(ext);
  if (ext.empty() || it == kSuffixes.end()) return name;
  return name.substr(0, name.size() - ext.size() - 1) + it->second;
}

std::string EntryName(struct archive_entry* entry) {
  const char* name = archive_entry_pathname_utf8(entry);
  if (name == nullptr) name = archive_entry_pathname(entry);
  return name == nullptr ? "" : name;
}

// A compressed single file: what it holds, extracted as its own kind.
void ExtractCompressed(const OpenedFile& file, struct archive* a, Json::Value& fields) {
  if (file.depth() >= kMaxNestingDepth) return;
  ExpansionGuard guard(a);
  std::string data;
  // A stream cut short or stopped by the guard still gives what came before.
  ReadMember(a, &guard, kMaxMemberBytes, &data);
  if (!data.empty()) ExtractMember(InnerName(file.name()), data, file.depth() + 1, fields);
}

}  // namespace

void StartExpansionBudget() { budget = ExpansionBudget{0, std::clock()}; }

void ExtractArchive(const OpenedFile& file, Json::Value& fields) {
  ArchivePtr archive = OpenArchive(file);
  struct archive* a = archive.get();
  ExpansionGuard guard(a);
  TextSink names(kMaxNamesBytes);
  TextSink texts(kMaxTextBytes);
  bool encrypted = false;
  struct archive_entry* entry;
  for (int count = 0; count < kMaxEntries && !guard.Tripped(); ++count) {
    const int rc = archive_read_next_header(a, &entry);
    if (rc == ARCHIVE_EOF) break;
    if (rc < ARCHIVE_WARN) {
      // A damaged or truncated archive keeps the names read before the damage.
      if (count == 0) Fail("not a readable archive: " + ArchiveError(a));
      break;
    }
    if (archive_format(a) == ARCHIVE_FORMAT_RAW) return ExtractCompressed(file, a, fields);
    const std::string name = EntryName(entry);
    names.Add(name);
    names.Break();
    // Some formats (ar) give their members no type at all: those are files too.
    const auto type = archive_entry_filetype(entry);
    if (type != AE_IFREG && type != 0) continue;
    if (archive_entry_is_encrypted(entry)) {
      encrypted = true;
      continue;
    }
    const bool wanted = file.depth() < kMaxNestingDepth && !texts.full() &&
                        CpuSeconds() < kMemberCpuSeconds &&
                        !(archive_entry_size_is_set(entry) &&
                          archive_entry_size(entry) > static_cast<la_int64_t>(kMaxMemberBytes));
    std::string data;
    // Held once at its size, not grown by doubling: three levels of members must fit the
    // helper's memory together.
    if (wanted && archive_entry_size_is_set(entry)) {
      data.reserve(static_cast<size_t>(std::max<la_int64_t>(archive_entry_size(entry), 0)));
    }
    // A member not wanted is still read through, not skipped: skipping inside a compressed
    // stream expands it all the same, out of the guard's sight.
    const Read read = ReadMember(a, &guard, kMaxMemberBytes, wanted ? &data : nullptr);
    // What was read of a member cut short still counts.
    if (!data.empty()) {
      try {
        Json::Value member(Json::objectValue);
        ExtractMember(name, data, file.depth() + 1, member);
        texts.Add(member["QUIXMDTextContent"].asString());
        texts.Break();
        if (member["QUIXMDIsEncrypted"].asBool()) encrypted = true;
      } catch (const std::exception&) {
        // A member that cannot be read costs its own text only.
      }
    }
    if (read == Read::kDamaged) break;
  }
  if (encrypted) fields["QUIXMDIsEncrypted"] = true;
  std::string text = names.Take();
  const std::string member_texts = texts.Take();
  if (!member_texts.empty()) text += "\n" + member_texts;
  text = CleanUtf8(text, kMaxTextBytes);
  if (!text.empty()) fields["QUIXMDTextContent"] = text;
}

}  // namespace extract
}  // namespace orvane
