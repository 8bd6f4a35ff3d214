#include "daemons/fileindexd/reconciler.hpp"

#include <dirent.h>
#include <sys/stat.h>
#include <syslog.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <memory>
#include <utility>

#include "common/comm.hpp"
#include "common/error.hpp"
#include "common/json_util.hpp"
#include "common/log.hpp"
#include "common/util.hpp"
#include "daemons/fileindexd/indexer.hpp"
#include "extract/content_extract.hpp"
#include "fileindex/elastic_control.hpp"
#include "fileindex/util.hpp"

namespace orvane {
namespace fileindexd {

namespace ce = QUIX::CONTENT_EXTRACT;

namespace {

int64_t IntOr(const Json::Value& v, int64_t fallback) {
  return v.isIntegral() ? v.asInt64() : fallback;
}

}  // namespace

EngineEntries::EngineEntries(const std::string& share, const std::string& dir)
    : id_(fileindex::elastic::GetFileIndexID(share)), dir_(dir) {}

EngineEntries::~EngineEntries() {
  if (!ahead_.valid()) return;
  try {
    ahead_.get();
  } catch (const std::exception&) {
    // The page was not wanted any more: its failure, if it is lasting, comes back next time.
  }
}

bool EngineEntries::Next(IndexedEntry* entry) {
  if (next_ >= page_.size()) {
    if (last_page_) return false;
    page_ = started_ ? ahead_.get() : Fetch(std::string());
    started_ = true;
    next_ = 0;
    // Only an empty page ends the listing: the engine may give fewer than asked on any page.
    if (page_.empty()) {
      last_page_ = true;
      return false;
    }
    // Keyed by the last path rather than an offset, the next page is right even though the
    // differences of this one reach the engine meanwhile: what they add sorts before it.
    ahead_ = std::async(std::launch::async, &EngineEntries::Fetch, this, page_.back().path);
  }
  *entry = std::move(page_[next_++]);
  return true;
}

std::vector<IndexedEntry> EngineEntries::Fetch(const std::string& after) const {
  Json::Value req(Json::objectValue);
  req["command"] = "document_list";
  Json::Value& data = req["data"];
  data["id"] = id_;
  data["path"] = dir_;
  if (!after.empty()) data["after"] = after;
  data["size"] = kListPageSize;
  data["load_field"].append(ce::QUIXMDAttributeChangeDate);
  Json::Value res;
  fileindex::elastic::SendRequest(res, req);
  const Json::Value& hits = res["data"];
  ORVANE_THROW_IF(!hits.isArray(), kErrNoQueryData, JsonToString(res));
  std::vector<IndexedEntry> page;
  page.reserve(hits.size());
  for (const Json::Value& hit : hits) {
    // A document left out would be judged gone and deleted: a reply not understood ends the
    // reconciliation instead.
    ORVANE_THROW_IF(!hit.isArray() || hit.size() < 5 || !hit[0].isString(), kErrNoQueryData,
                    "unexpected document listing entry: " + JsonToString(hit));
    IndexedEntry e;
    e.path = hit[0].asString();
    e.size = IntOr(hit[1], -1);
    e.mtime = IntOr(hit[2], -1);
    e.is_dir = hit[3].isBool() && hit[3].asBool();
    e.ctime = IntOr(hit[4], -1);
    page.push_back(std::move(e));
  }
  return page;
}

Reconciler::Reconciler(const fileindex::FolderMgr& folders, const std::atomic<bool>* stop,
                       std::function<void(const ReconcileCounts&)> progress)
    : folders_(folders), stop_(stop), progress_(std::move(progress)) {}

bool Reconciler::Run(const std::string& root, IndexedEntries& index, ReconcileSink& sink) {
  index_ = &index;
  sink_ = &sink;
  counts_ = ReconcileCounts();
  Advance();
  struct stat st;
  if (lstat(root.c_str(), &st) == 0) {
    const DiskEntry disk{S_ISDIR(st.st_mode), static_cast<int64_t>(st.st_size),
                         static_cast<int64_t>(st.st_mtim.tv_sec),
                         static_cast<int64_t>(st.st_ctim.tv_sec)};
    if (disk.is_dir) {
      const bool indexable = Indexable(root);
      if (indexable || HasFolderBelow(root)) {
        indexable ? Visit(root, disk) : Pass(root);
        Walk(root, st.st_dev, indexable);
      }
    } else if (S_ISREG(st.st_mode) && folders_.GetMostSuitableCfg(root) &&
               fileindex::CanFullPathBeIndexed(root)) {
      Visit(root, disk);
    }
  }
  // What a stopped walk did not reach is not gone.
  if (Stopping()) return false;
  RemoveBefore(nullptr);
  if (progress_) progress_(counts_);
  return true;
}

void Reconciler::Walk(const std::string& dir, dev_t dev, bool indexable) {
  if (Stopping()) return;
  DIR* raw = opendir(dir.c_str());
  if (raw == nullptr) {
    Log(LOG_WARNING, "fileindexd: cannot read %s: %s", dir.c_str(), strerror(errno));
    Keep(dir);
    return;
  }
  std::unique_ptr<DIR, int (*)(DIR*)> closer(raw, closedir);
  // The index lists documents in byte order of their full paths, so a directory's entries are
  // taken in byte order of their names, and what lies below a subdirectory "d" at the place of
  // "d/": after "d.txt", before "d0".
  enum Kind : uint8_t { kVisit, kPass, kBelow, kBelowIndexable };
  struct Item {
    std::string key;
    DiskEntry disk;
    Kind kind;
  };
  std::vector<Item> items;
  while (struct dirent* entry = readdir(raw)) {
    // Per entry rather than per directory: one flat directory may hold most of a share.
    if (Stopping()) return;
    const std::string name = entry->d_name;
    if (name == "." || name == "..") continue;
    const std::string path = dir + "/" + name;
    struct stat st;
    if (lstat(path.c_str(), &st) != 0) continue;
    const DiskEntry disk{S_ISDIR(st.st_mode), static_cast<int64_t>(st.st_size),
                         static_cast<int64_t>(st.st_mtim.tv_sec),
                         static_cast<int64_t>(st.st_ctim.tv_sec)};
    if (disk.is_dir) {
      // Other file systems mounted below are not ours to index.
      if (st.st_dev != dev) continue;
      const bool sub_indexable = Indexable(path);
      if (!sub_indexable && !HasFolderBelow(path)) continue;
      items.push_back({name, disk, sub_indexable ? kVisit : kPass});
      items.push_back({name + "/", disk, sub_indexable ? kBelowIndexable : kBelow});
      continue;
    }
    if (!indexable || !S_ISREG(st.st_mode)) continue;
    if (fileindex::IsSystemPreservedFileName(name)) continue;
    items.push_back({name, disk, kVisit});
  }
  closer.reset();
  std::sort(items.begin(), items.end(), [](const Item& a, const Item& b) { return a.key < b.key; });
  for (const Item& item : items) {
    if (Stopping()) return;
    switch (item.kind) {
      case kVisit:
        Visit(dir + "/" + item.key, item.disk);
        break;
      case kPass:
        Pass(dir + "/" + item.key);
        break;
      case kBelow:
      case kBelowIndexable:
        Walk(dir + "/" + item.key.substr(0, item.key.size() - 1), dev,
             item.kind == kBelowIndexable);
        break;
    }
  }
}

void Reconciler::Visit(const std::string& path, const DiskEntry& disk) {
  ++counts_.compared;
  if (progress_ && counts_.compared % kProgressEvery == 0) progress_(counts_);
  RemoveBefore(&path);
  if (!has_current_ || current_.path != path) {
    sink_->Add(path, disk.is_dir);
    ++counts_.added;
    return;
  }
  if (current_.is_dir != disk.is_dir) {
    const bool was_dir = current_.is_dir;
    Advance();
    ++counts_.refreshed;
    if (was_dir) {
      // A directory replaced by a file: the directory's documents go in one delete.
      uint64_t below = 0;
      SkipBelow(path, &below);
      sink_->Remove(path, true);
      counts_.removed += below;
    }
    sink_->Refresh(path, disk.is_dir, true);
    return;
  }
  const bool contents = current_.size != disk.size || current_.mtime != disk.mtime;
  // A document without a change time is refreshed once, so that it has one from then on.
  const bool attributes = current_.ctime != disk.ctime;
  Advance();
  if (!contents && !attributes) return;
  sink_->Refresh(path, disk.is_dir, contents);
  ++counts_.refreshed;
}

void Reconciler::Pass(const std::string& path) {
  RemoveBefore(&path);
  if (has_current_ && current_.path == path) {
    // The rules no longer index the directory itself; what lies below is judged on its own.
    sink_->Remove(path, false);
    ++counts_.removed;
    Advance();
  }
}

void Reconciler::Keep(const std::string& dir) {
  const std::string below = dir + "/";
  RemoveBefore(&below);
  uint64_t kept = 0;
  SkipBelow(dir, &kept);
}

void Reconciler::RemoveBefore(const std::string* path) {
  while (has_current_ && (path == nullptr || current_.path < *path)) RemoveCurrent();
}

void Reconciler::RemoveCurrent() {
  const std::string path = current_.path;
  const bool dir = current_.is_dir;
  Advance();
  uint64_t below = 0;
  if (dir) SkipBelow(path, &below);
  sink_->Remove(path, dir);
  counts_.removed += 1 + below;
}

void Reconciler::Advance() { has_current_ = index_->Next(&current_); }

void Reconciler::SkipBelow(const std::string& dir, uint64_t* skipped) {
  const std::string below = dir + "/";
  while (has_current_ && current_.path.compare(0, below.size(), below) == 0) {
    ++*skipped;
    Advance();
  }
}

bool Reconciler::Indexable(const std::string& dir) const {
  return folders_.GetMostSuitableCfg(dir) && fileindex::CanFullPathBeIndexed(dir);
}

bool Reconciler::HasFolderBelow(const std::string& dir) const {
  const std::string below = dir + "/";
  for (const auto& folder : folders_.folders()) {
    if (StringStartWith(folder->GetFullPath() + "/", below) && folder->GetFullPath() != dir) {
      return true;
    }
  }
  return false;
}

}  // namespace fileindexd
}  // namespace orvane
