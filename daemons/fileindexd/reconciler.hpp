// Reconciler settles one folder's documents with the disk without reading unchanged files: it
// walks the folder under the crawl's path rules in path order, merges that with the index's
// documents of the folder in the same order, and hands exactly the differences to a sink. One
// per reconciliation; not thread-safe. A stop flag, when given, ends it early.
#ifndef ORVANE_DAEMONS_FILEINDEXD_RECONCILER_HPP_
#define ORVANE_DAEMONS_FILEINDEXD_RECONCILER_HPP_

#include <sys/types.h>

#include <atomic>
#include <cstdint>
#include <functional>
#include <future>
#include <string>
#include <vector>

#include "fileindex/folder_mgr.hpp"

namespace orvane {
namespace fileindexd {

// What the index records of one entry; -1 where the document has no value.
struct IndexedEntry {
  std::string path;
  bool is_dir = false;
  int64_t size = -1;
  int64_t mtime = -1;
  int64_t ctime = -1;
};

// The documents at and below one folder, in byte order of their paths.
class IndexedEntries {
 public:
  virtual ~IndexedEntries() = default;
  // The next document; false after the last. Throws the index's Error.
  virtual bool Next(IndexedEntry* entry) = 0;
};

// Pages through the engine's listing of one share's index below a folder. The next page is
// asked for on a thread of its own while the caller works through the current one; the
// destructor waits for it.
class EngineEntries : public IndexedEntries {
 public:
  EngineEntries(const std::string& share, const std::string& dir);
  ~EngineEntries() override;
  EngineEntries(const EngineEntries&) = delete;
  EngineEntries& operator=(const EngineEntries&) = delete;
  bool Next(IndexedEntry* entry) override;

 private:
  // The page of documents after `after` (from the start when empty); empty after the last.
  std::vector<IndexedEntry> Fetch(const std::string& after) const;

  std::string id_;
  std::string dir_;
  std::vector<IndexedEntry> page_;
  size_t next_ = 0;
  bool started_ = false;
  bool last_page_ = false;
  std::future<std::vector<IndexedEntry>> ahead_;
};

// What a reconciliation does about each difference.
class ReconcileSink {
 public:
  virtual ~ReconcileSink() = default;
  // `path` is on the disk and has no document.
  virtual void Add(const std::string& path, bool is_dir) = 0;
  // The document of `path` is out of date: its contents (size, modification time or type
  // changed) or only its attributes (owner, mode: the change time moved).
  virtual void Refresh(const std::string& path, bool is_dir, bool contents) = 0;
  // `path` is gone; with `subtree`, every document below it goes with it.
  virtual void Remove(const std::string& path, bool subtree) = 0;
};

struct ReconcileCounts {
  uint64_t compared = 0;   // entries of the disk looked at
  uint64_t added = 0;      // documents added
  uint64_t removed = 0;    // documents removed (a directory and everything below it)
  uint64_t refreshed = 0;  // documents brought up to date
};

class Reconciler {
 public:
  // Entries compared between two calls of the progress callback.
  static constexpr uint64_t kProgressEvery = 1000;

  // `folders` gives the path rules; `progress`, when set, is called with the counts so far.
  Reconciler(const fileindex::FolderMgr& folders, const std::atomic<bool>* stop,
             std::function<void(const ReconcileCounts&)> progress);
  Reconciler(const Reconciler&) = delete;
  Reconciler& operator=(const Reconciler&) = delete;

  // Reconciles `root` (a full path) and everything below it. False when stopped: what was
  // handed to the sink so far is right, what it did not reach was not judged. Throws the
  // index's Error.
  bool Run(const std::string& root, IndexedEntries& index, ReconcileSink& sink);
  const ReconcileCounts& counts() const { return counts_; }

 private:
  // What the walk needs of an entry of the disk.
  struct DiskEntry {
    bool is_dir;
    int64_t size;
    int64_t mtime;
    int64_t ctime;
  };

  void Walk(const std::string& dir, dev_t dev, bool indexable);
  // The disk holds `path`, which the rules index.
  void Visit(const std::string& path, const DiskEntry& disk);
  // The disk holds `path`, a directory the rules do not index but walk for folders below it.
  void Pass(const std::string& path);
  // `dir` could not be read: what the index holds below it is kept.
  void Keep(const std::string& dir);
  // Judges every document before `path` (all remaining ones when null) as gone.
  void RemoveBefore(const std::string* path);
  void RemoveCurrent();
  void Advance();
  void SkipBelow(const std::string& dir, uint64_t* skipped);
  bool Indexable(const std::string& dir) const;
  bool HasFolderBelow(const std::string& dir) const;
  bool Stopping() const { return stop_ != nullptr && stop_->load(); }

  const fileindex::FolderMgr& folders_;
  const std::atomic<bool>* stop_;
  std::function<void(const ReconcileCounts&)> progress_;
  IndexedEntries* index_ = nullptr;
  ReconcileSink* sink_ = nullptr;
  IndexedEntry current_;
  bool has_current_ = false;
  ReconcileCounts counts_;
};

}  // namespace fileindexd
}  // namespace orvane

#endif  // ORVANE_DAEMONS_FILEINDEXD_RECONCILER_HPP_
