// Indexer turns the coalesced operations of one share's queue into document commands for the
// search engine, and crawls directories when an operation stands for a whole subtree. It reads
// the folder configuration once per pass (BeginPass) and judges the path rules once per
// directory. One per worker; not thread-safe. A stop flag, when given, ends a crawl early.
#ifndef ORVANE_DAEMONS_FILEINDEXD_INDEXER_HPP_
#define ORVANE_DAEMONS_FILEINDEXD_INDEXER_HPP_

#include <json/json.h>

#include <atomic>
#include <cstdint>
#include <functional>
#include <memory>
#include <string>
#include <unordered_set>
#include <vector>

#include "daemons/fileindexd/reconciler.hpp"
#include "fileindex/folder_mgr.hpp"
#include "fileindex/optree.hpp"

namespace orvane {
namespace fileindexd {

// Upserts and deletes a crawl sends per compound request.
constexpr size_t kCrawlBatchSize = 512;
// Documents of a name and attributes only, which are small, per compound request.
constexpr size_t kBulkBatchSize = 2048;
// ... or fewer, once the contents extracted for a batch reach about this many bytes, so that a
// crawl of large text files does not hold hundreds of them in memory at once.
constexpr uint64_t kCrawlBatchBytes = 8 << 20;
// Documents asked for per page when listing what the index holds below a directory.
constexpr unsigned int kListPageSize = 10000;

class Indexer {
 public:
  Indexer(const std::string& share, const std::atomic<bool>* stop);
  Indexer(const Indexer&) = delete;
  Indexer& operator=(const Indexer&) = delete;

  // Re-reads the folder configuration; called before the operations of a pass.
  void BeginPass();
  // Sends the commands of one operation. Throws the Error of the failing command.
  void Apply(const fileindex::OP& op);

  // Operations may be started ahead so that one slow file does not hold back the rest: the
  // upsert of a file whose contents are extracted is taken by UpsertAhead (true) and its
  // command is sent by a later SettleAhead, once its extraction ends. Before each operation the
  // caller calls SettleAhead with it, which sends what has finished and waits for the upserts
  // at, above or below a path of that operation, so no later command is overtaken by an
  // earlier upsert; SettleAhead(nullptr) waits for all of them. SettleAhead returns the
  // operations whose command failed on its own, to be applied again the ordinary way, and
  // throws the engine's Error when it could not take one.
  ~Indexer();
  bool UpsertAhead(const std::shared_ptr<fileindex::OP>& op);
  std::vector<std::shared_ptr<fileindex::OP>> SettleAhead(const fileindex::OP* op);

  // Called when a reconciliation of `folder` starts (zero counts), as it goes and, with
  // `finished`, once its differences are sent; a stopped or failed one never finishes.
  using ReconcileObserver =
      std::function<void(const std::string& folder, const ReconcileCounts& counts, bool finished)>;
  void SetReconcileObserver(ReconcileObserver observer) { observer_ = std::move(observer); }

  // The document commands the indexer sent, for the status report.
  uint64_t documents_written() const { return documents_written_; }
  uint64_t documents_deleted() const { return documents_deleted_; }
  // The paths too long to open (PATH_MAX and more) that were met and skipped, as hashes of
  // their text, and the first of them in full.
  const std::unordered_set<size_t>& long_paths() const { return long_paths_; }
  const std::string& first_long_path() const { return first_long_path_; }

  // The paths of every document at or below `dir` in `share`'s index, paged.
  static std::unordered_set<std::string> ListDocuments(const std::string& share,
                                                       const std::string& dir);

 private:
  // What a crawl upserts: everything, or only files that have no document yet or whose kind of
  // content was switched (`kinds`: the "document", "audio", "video", "photo" switches).
  struct CrawlMode {
    bool all = true;
    Json::Value kinds;
  };
  class Sender;
  class Batch;
  struct Ahead;
  class ReconcileBatch;

  void Upsert(const std::string& path);
  void Attr(const std::string& path);
  void Rename(const std::string& path, const std::string& old_path);
  // Deletes the documents at and below `path`, whose name now holds something never indexed.
  void DeleteReplaced(const std::string& path);
  // Indexes what exists below `root` (and `root` itself); with `reconcile`, also deletes the
  // documents at or below `root` that the walk did not meet.
  void Crawl(const std::string& root, const CrawlMode& mode, bool reconcile);
  // Sends only the differences between the disk and the documents at or below `root`.
  void Reconcile(const std::string& root);
  void CrawlDir(const std::string& dir, dev_t dev, const CrawlMode& mode, Batch& batch,
                std::unordered_set<std::string>* stale);
  // Whether some configured folder lies strictly below `dir`.
  bool HasFolderBelow(const std::string& dir) const;
  bool KindSwitched(const CrawlMode& mode, const std::string& path) const;
  bool Stopping() const { return stop_ != nullptr && stop_->load(); }
  void NoteLongPath(const std::string& path);

  std::string share_;
  const std::atomic<bool>* stop_;
  std::unique_ptr<fileindex::FolderMgr> folders_;
  ReconcileObserver observer_;
  uint64_t documents_written_ = 0;
  uint64_t documents_deleted_ = 0;
  std::unordered_set<size_t> long_paths_;
  std::string first_long_path_;
  std::unique_ptr<Ahead> ahead_;  // created with the first upsert started ahead
};

}  // namespace fileindexd
}  // namespace orvane

#endif  // ORVANE_DAEMONS_FILEINDEXD_INDEXER_HPP_
