#include "daemons/fileindexd/indexer.hpp"

#include <dirent.h>
#include <sys/stat.h>
#include <sys/sysmacros.h>
#include <syslog.h>

#include <fcntl.h>

#include <cerrno>
#include <climits>
#include <chrono>
#include <condition_variable>
#include <cstring>
#include <deque>
#include <exception>
#include <functional>
#include <map>
#include <mutex>
#include <thread>
#include <utility>

#include "common/comm.hpp"
#include "common/error.hpp"
#include "common/json_util.hpp"
#include "common/log.hpp"
#include "common/util.hpp"
#include "daemons/fileindexd/parse_pool.hpp"
#include "daemons/quixelasticd/bulk_codec.hpp"
#include "extract/content_extract.hpp"
#include "fileindex/elastic_control.hpp"
#include "fileindex/util.hpp"

namespace orvane {
namespace fileindexd {

namespace el = fileindex::elastic;
using fileindex::OP;

namespace {

// Whether a path is too long for the kernel to take by name (its NUL included).
bool TooLong(const std::string& path) { return path.size() >= PATH_MAX; }

bool IsSubPath(const std::string& path, const std::string& dir) {
  return StringStartWith(path + "/", dir + "/");
}

Json::Value Command(const char* name, Json::Value data) {
  Json::Value req(Json::objectValue);
  req["command"] = name;
  req["data"] = std::move(data);
  return req;
}

// A command about one document, named by its index and path.
Json::Value DocumentCommand(const char* name, const std::string& id, const std::string& path) {
  Json::Value data(Json::objectValue);
  data["id"] = id;
  data["doc_id"] = path;
  return Command(name, std::move(data));
}

Json::Value DocumentCommand(const char* name, const std::string& id, const std::string& path,
                            Json::Value doc) {
  Json::Value req = DocumentCommand(name, id, path);
  req["data"]["data"] = std::move(doc);
  return req;
}

// A file's extracted document, searchable by its own name and by its folder's.
Json::Value UpsertCommand(const std::string& id, ParsePool::Result& result) {
  Json::Value& doc = result.doc;
  doc[QUIX::CONTENT_EXTRACT::QUIXMDSearchFileName] = doc[QUIX::CONTENT_EXTRACT::QUIXMDFSName];
  doc[QUIX::CONTENT_EXTRACT::QUIXMDSearchAncestor] = doc[QUIX::CONTENT_EXTRACT::QUIXMDParent];
  return DocumentCommand("document_upsert_by_id", id, result.path, std::move(doc));
}

}  // namespace

// Sends the requests of one crawl on a thread of its own, so that the crawl reads the disk and
// extracts while the engine writes the batch before. At most kDepth requests wait, which bounds
// memory however fast the crawl runs. The first failure stops the sending; the crawl sees it at
// its next Push or Drain. A stop, or destroying it, drops what waits and lets the request on its
// way finish.
class Indexer::Sender {
 public:
  static constexpr size_t kDepth = 2;

  explicit Sender(const std::atomic<bool>* stop) : stop_(stop) {}
  Sender(const Sender&) = delete;
  Sender& operator=(const Sender&) = delete;
  ~Sender() {
    {
      std::lock_guard<std::mutex> lock(mu_);
      quit_ = true;
      queue_.clear();
    }
    cv_.notify_all();
    if (thread_.joinable()) thread_.join();
  }

  void Push(Json::Value req) {
    std::unique_lock<std::mutex> lock(mu_);
    if (!thread_.joinable()) thread_ = std::thread([this] { Run(); });
    Wait(lock, [this] { return failure_ || queue_.size() < kDepth; });
    if (failure_) std::rethrow_exception(failure_);
    if (!Stopping()) queue_.push_back(std::move(req));
    cv_.notify_all();
  }
  // Waits until everything pushed was taken by the engine, or the crawl is stopped.
  void Drain() {
    std::unique_lock<std::mutex> lock(mu_);
    Wait(lock, [this] { return failure_ || (queue_.empty() && !busy_); });
    if (failure_) std::rethrow_exception(failure_);
  }

 private:
  void Run() {
    std::unique_lock<std::mutex> lock(mu_);
    for (;;) {
      cv_.wait(lock, [this] { return quit_ || !queue_.empty(); });
      if (quit_ || failure_) return;
      // A stopped crawl sends nothing more: its operation stays queued and runs again.
      if (Stopping()) {
        queue_.clear();
        cv_.notify_all();
        continue;
      }
      Json::Value req = std::move(queue_.front());
      queue_.pop_front();
      busy_ = true;
      lock.unlock();
      std::exception_ptr failure;
      try {
        el::SendRequest(req);
      } catch (...) {
        failure = std::current_exception();
      }
      lock.lock();
      busy_ = false;
      if (failure) {
        failure_ = failure;
        queue_.clear();
      }
      cv_.notify_all();
    }
  }

  bool Stopping() const { return stop_ != nullptr && stop_->load(); }
  // Waits for `done` or a stop, which nobody signals: it is looked at every few milliseconds.
  template <typename Pred>
  void Wait(std::unique_lock<std::mutex>& lock, Pred done) {
    while (!done() && !Stopping()) cv_.wait_for(lock, std::chrono::milliseconds(20));
  }

  const std::atomic<bool>* stop_;
  std::mutex mu_;
  std::condition_variable cv_;
  std::deque<Json::Value> queue_;
  bool busy_ = false;
  bool quit_ = false;
  std::exception_ptr failure_;
  std::thread thread_;
};

// Collects document commands and sends them as compound requests, so a crawl of many files
// costs one engine transaction per batch rather than one connection per file. Documents of a
// name and attributes only go in the compact bulk form; those with contents are extracted on a
// pool of threads, several files at once, and go as JSON. A crawl names each path once, so the
// documents may go out in the order their extraction ends.
class Indexer::Batch {
 public:
  explicit Batch(Indexer* owner)
      : owner_(owner),
        id_(el::GetFileIndexID(owner->share_)),
        reqs_(Json::arrayValue),
        sender_(owner->stop_) {}
  Batch(const Batch&) = delete;
  Batch& operator=(const Batch&) = delete;

  // `st`, when given, is what the crawl just read of `path` (statx, basic fields and birth
  // time); it spares a second look.
  void Upsert(const std::string& path, bool need_meta, const struct statx* st = nullptr) {
    // An empty file has no contents to extract: it is described by its attributes alone.
    if (need_meta && (st == nullptr || !S_ISREG(st->stx_mode) || st->stx_size > 0)) {
      pool_.Submit(path, true);
      // Bounded, so that memory stays bounded however large the folder: a slow file holds one
      // thread while the others go on, and what they finish is taken here.
      ParsePool::Result result;
      while (pool_.Next(&result, pool_.outstanding() > kMaxInFlightPerThread * pool_.threads())) {
        Add(std::move(result), true);
      }
      return;
    }
    struct statx own;
    if (st == nullptr) {
      if (statx(AT_FDCWD, path.c_str(), AT_SYMLINK_NOFOLLOW, STATX_BASIC_STATS | STATX_BTIME,
                &own) != 0) {
        Log(LOG_WARNING, "fileindexd: %s not indexed: %s", path.c_str(), strerror(errno));
        return;
      }
      st = &own;
    }
    if (bulk_.Add(path, *st)) {
      ++owner_->documents_written_;
      if (bulk_.count() >= kBulkBatchSize) Send();
      return;
    }
    ParsePool::Result result;
    result.path = path;
    Json::Value config(Json::objectValue);
    config["need_meta"] = false;
    try {
      QUIX::CONTENT_EXTRACT::ParseFile(path, config, result.doc);
      result.ok = true;
    } catch (const std::exception& e) {
      result.error = e.what();
    }
    Add(std::move(result), false);
  }
  // Only the file-system fields: the contents kept in the document stay as they are.
  void SetAttributes(const std::string& path) {
    Json::Value config(Json::objectValue);
    config["need_meta"] = false;
    Json::Value doc;
    try {
      QUIX::CONTENT_EXTRACT::ParseFile(path, config, doc);
    } catch (const std::exception& e) {
      Log(LOG_WARNING, "fileindexd: %s not refreshed: %s", path.c_str(), e.what());
      return;
    }
    bytes_ += 512;
    Add(DocumentCommand("document_set_by_id", id_, path, std::move(doc)));
    ++owner_->documents_written_;
  }
  void Delete(const std::string& path) {
    Add(DocumentCommand("document_del_by_id", id_, path));
    ++owner_->documents_deleted_;
  }
  // Every document below `dir`, in one command.
  void DeleteBelow(const std::string& dir) {
    Json::Value data(Json::objectValue);
    data["id"] = id_;
    data["query"]["qsl"]["prefix"][QUIX::CONTENT_EXTRACT::QUIXMDPath] = dir + "/";
    Add(Command("document_del_by_query", std::move(data)));
  }
  // Sends everything, waiting for the extractions still running and for the engine; what is
  // ready is sent before each wait, so the files done are searchable while a slow one is still
  // being read.
  void Flush() {
    ParsePool::Result result;
    for (;;) {
      while (pool_.Next(&result, false)) Add(std::move(result), true);
      Send();
      if (!pool_.Next(&result, true)) break;
      Add(std::move(result), true);
    }
    sender_.Drain();
  }

 private:
  static constexpr size_t kMaxInFlightPerThread = 4;

  // A file whose attributes cannot be read any more is simply not indexed: it went away while
  // the crawl ran, and its delete event follows.
  void Add(ParsePool::Result result, bool need_meta) {
    if (!result.ok) {
      Log(LOG_WARNING, "fileindexd: %s not indexed: %s", result.path.c_str(),
          result.error.c_str());
      return;
    }
    // Name-only documents are small; with contents the file's size bounds the extracted text.
    bytes_ +=
        need_meta ? 512 + result.doc[QUIX::CONTENT_EXTRACT::QUIXMDFSSize].asUInt64() : 512;
    Add(UpsertCommand(id_, result));
    ++owner_->documents_written_;
  }
  void Add(Json::Value req) {
    // The compact documents gathered so far go first: commands keep the order they were made.
    CloseBulk();
    reqs_.append(std::move(req));
    if (reqs_.size() >= kCrawlBatchSize || bytes_ >= kCrawlBatchBytes) Send();
  }
  void CloseBulk() {
    if (bulk_.count() == 0) return;
    Json::Value data(Json::objectValue);
    data["id"] = id_;
    data["docs"] = bulk_.Take();
    reqs_.append(Command(elasticd::kBulkUpsertCommand, std::move(data)));
  }
  void Send() {
    CloseBulk();
    if (reqs_.empty()) return;
    Json::Value req(Json::objectValue);
    req["compound"] = std::move(reqs_);
    reqs_ = Json::Value(Json::arrayValue);
    bytes_ = 0;
    sender_.Push(std::move(req));
  }

  Indexer* owner_;
  std::string id_;
  Json::Value reqs_;
  elasticd::BulkEncoder bulk_;
  uint64_t bytes_ = 0;
  Sender sender_;
  // Declared last: destroyed first, before the requests its results would have joined.
  ParsePool pool_;
};

// The upserts started ahead: their extraction pool and, by path, the operations waiting there.
struct Indexer::Ahead {
  // Upserts started ahead at once, per extraction thread: enough to keep every thread busy
  // behind a slow file, few enough that their documents stay small in memory.
  static constexpr size_t kPerThread = 4;

  ParsePool pool;
  std::map<std::string, std::shared_ptr<OP>> ops;
};

// Turns the differences a reconciliation finds into the commands of a batch.
class Indexer::ReconcileBatch : public ReconcileSink {
 public:
  ReconcileBatch(Indexer* owner, Batch* batch) : owner_(owner), batch_(batch) {}

  void Add(const std::string& path, bool is_dir) override {
    batch_->Upsert(path, !is_dir && owner_->folders_->IsFullPathNeedMeta(path));
  }
  void Refresh(const std::string& path, bool is_dir, bool contents) override {
    if (contents || is_dir) {
      Add(path, is_dir);
    } else {
      batch_->SetAttributes(path);
    }
  }
  void Remove(const std::string& path, bool subtree) override {
    batch_->Delete(path);
    if (subtree) batch_->DeleteBelow(path);
  }

 private:
  Indexer* owner_;
  Batch* batch_;
};

Indexer::Indexer(const std::string& share, const std::atomic<bool>* stop)
    : share_(share), stop_(stop) {}

// Upserts still being extracted are dropped: their operations were not done, and the batch that
// holds them is done again by the next pass.
Indexer::~Indexer() = default;

bool Indexer::UpsertAhead(const std::shared_ptr<OP>& op) {
  if (op->op != fileindex::kOPUpsert) return false;
  if (!folders_) BeginPass();
  const auto node = op->node.lock();
  if (!node) return false;
  const std::string path = node->GetPath();
  struct stat st;
  if (lstat(path.c_str(), &st) != 0 || !S_ISREG(st.st_mode)) return false;
  // Only contents are slow: a name and attributes are sent at once, the ordinary way.
  if (!folders_->GetMostSuitableCfg(path) || !fileindex::CanFullPathBeIndexed(path) ||
      !folders_->IsFullPathNeedMeta(path)) {
    return false;
  }
  if (!ahead_) ahead_ = std::make_unique<Ahead>();
  // One path is pending once: SettleAhead(op) sent the earlier one, as the same path conflicts.
  if (ahead_->ops.count(path) != 0) return false;
  ahead_->ops[path] = op;
  ahead_->pool.Submit(path, true);
  return true;
}

std::vector<std::shared_ptr<OP>> Indexer::SettleAhead(const OP* op) {
  std::vector<std::shared_ptr<OP>> failed;
  if (!ahead_) return failed;
  std::vector<std::string> paths;
  if (op != nullptr) {
    if (const auto node = op->node.lock()) paths.push_back(node->GetPath());
    if (op->op == fileindex::kOPRename) paths.push_back(op->path);
  }
  // Every pending path when there is no operation; else those at, above or below its paths
  // (the root's path, "", is above everything).
  const auto conflicts = [&](const std::string& pending) {
    if (op == nullptr) return true;
    for (const std::string& p : paths) {
      if (pending == p || IsSubPath(pending, p) || IsSubPath(p, pending)) return true;
    }
    return false;
  };
  const auto blocked = [&] {
    if (ahead_->ops.size() >= Ahead::kPerThread * ahead_->pool.threads()) return true;
    for (const auto& [pending, unused] : ahead_->ops) {
      if (conflicts(pending)) return true;
    }
    return false;
  };
  const std::string id = el::GetFileIndexID(share_);
  const auto send = [&](ParsePool::Result result) {
    auto it = ahead_->ops.find(result.path);
    if (it == ahead_->ops.end()) return;
    std::shared_ptr<OP> done = std::move(it->second);
    ahead_->ops.erase(it);
    if (!result.ok) {
      // Gone or changed since: the ordinary way looks again and says what happened.
      failed.push_back(std::move(done));
      return;
    }
    try {
      el::SendRequest(UpsertCommand(id, result));
      ++documents_written_;
    } catch (const Error& e) {
      // The engine, the volume or the index failing is the pass's to handle; the rest is this
      // file's, tried again the ordinary way.
      if (e.code == kErrElastic || e.code == kErrSpaceNotEnough || e.code == kErrIndexDamaged) {
        throw;
      }
      failed.push_back(std::move(done));
    }
  };
  ParsePool::Result result;
  for (;;) {
    while (ahead_->pool.Next(&result, false)) send(std::move(result));
    if (!blocked() || !ahead_->pool.Next(&result, true)) break;
    send(std::move(result));
  }
  return failed;
}

void Indexer::BeginPass() { folders_ = std::make_unique<fileindex::FolderMgr>(); }

void Indexer::Apply(const OP& op) {
  if (!folders_) BeginPass();
  const auto node = op.node.lock();
  ORVANE_THROW_IF(!node, kErrOPTreePath, "operation without a node");
  const std::string path = node->GetPath();
  switch (op.op) {
    case fileindex::kOPNone:
      break;
    case fileindex::kOPDelete:
      el::IndexDel(share_, path);
      el::IndexDelDir(share_, path);
      documents_deleted_ += 1;
      break;
    case fileindex::kOPUpsert:
      Upsert(path);
      break;
    case fileindex::kOPAttr:
      Attr(path);
      break;
    case fileindex::kOPUpdateDirectory: {
      CrawlMode mode;
      mode.all = false;
      mode.kinds = op.data;
      Crawl(path, mode, true);
      break;
    }
    case fileindex::kOPRename:
      Rename(path, op.path);
      break;
    case fileindex::kOPReindex:
      if (fileindex::IsReconcile(op.data)) {
        Reconcile(path);
      } else {
        Crawl(path, CrawlMode(), true);
      }
      break;
    case fileindex::kOPCrash:
      // Whatever the lost events said, the indexed folders themselves are the truth.
      for (const auto& folder : folders_->folders()) {
        if (folder->GetShare() != share_) continue;
        Crawl(folder->GetFullPath(), CrawlMode(), true);
        if (Stopping()) break;
      }
      break;
  }
}

void Indexer::NoteLongPath(const std::string& path) {
  if (long_paths_.insert(std::hash<std::string>()(path)).second && first_long_path_.empty()) {
    first_long_path_ = path;
  }
}

void Indexer::Upsert(const std::string& path) {
  struct stat st;
  if (lstat(path.c_str(), &st) != 0) {
    if (errno == ENAMETOOLONG) NoteLongPath(path);
    return;  // gone again; its delete is queued
  }
  // Before the rules: they look through a link at what it names.
  if (!S_ISREG(st.st_mode) && !S_ISDIR(st.st_mode)) {
    DeleteReplaced(path);
    return;
  }
  if (!folders_->GetMostSuitableCfg(path) || !fileindex::CanFullPathBeIndexed(path)) return;
  if (S_ISDIR(st.st_mode)) {
    Crawl(path, CrawlMode(), false);
    return;
  }
  el::IndexUpsert(share_, path, folders_->IsFullPathNeedMeta(path));
  ++documents_written_;
}

void Indexer::DeleteReplaced(const std::string& path) {
  // A link, FIFO, socket or device is never indexed, so nothing else would ever remove the
  // document of the file or folder it replaced, and a link would lend that document the
  // permissions of whatever it points to.
  el::IndexDel(share_, path);
  el::IndexDelDir(share_, path);
  ++documents_deleted_;
}

void Indexer::Attr(const std::string& path) {
  struct stat st;
  if (lstat(path.c_str(), &st) != 0) {
    if (errno == ENAMETOOLONG) NoteLongPath(path);
    return;
  }
  if (!S_ISREG(st.st_mode) && !S_ISDIR(st.st_mode)) {
    DeleteReplaced(path);
    return;
  }
  if (!folders_->GetMostSuitableCfg(path) || !fileindex::CanFullPathBeIndexed(path)) return;
  try {
    el::IndexAttr(share_, path);
    ++documents_written_;
  } catch (const Error& e) {
    if (e.code != kErrNoDocument) throw;
    Upsert(path);
  }
}

void Indexer::Rename(const std::string& path, const std::string& old_path) {
  // A move to a place no folder covers (or that the rules refuse) is a delete of the old name.
  struct stat st;
  const bool exists = lstat(path.c_str(), &st) == 0;
  // Something never indexed (a link, a FIFO, ...) moved over the new name: the old name had no
  // document, and the new name's document is of the file it replaced. Decided before the
  // rules, which look through a link at what it names.
  const bool replaced = exists && !S_ISREG(st.st_mode) && !S_ISDIR(st.st_mode);
  const bool indexable = exists && !replaced && folders_->GetMostSuitableCfg(path) &&
                         fileindex::CanFullPathBeIndexed(path);
  if (!indexable) {
    el::IndexDel(share_, old_path);
    el::IndexDelDir(share_, old_path);
    if (replaced) DeleteReplaced(path);
    return;
  }
  try {
    el::IndexRename(share_, path, old_path);
    ++documents_written_;
  } catch (const Error& e) {
    if (e.code != kErrNoDocument) throw;
    // The documents below the old name may still exist even when its own does not.
    el::IndexDelDir(share_, old_path);
    Crawl(path, CrawlMode(), false);
    return;
  }
  // Rules and settings may differ at the new place: settle the subtree there.
  if (S_ISDIR(st.st_mode)) {
    CrawlMode mode;
    mode.all = false;
    mode.kinds = Json::Value(Json::objectValue);
    Crawl(path, mode, true);
  } else if (!IsSubPath(path, Dirname(old_path)) ||
             GetFileExtension(path, true) != GetFileExtension(old_path, true)) {
    Upsert(path);
  }
}

std::unordered_set<std::string> Indexer::ListDocuments(const std::string& share,
                                                       const std::string& dir) {
  std::unordered_set<std::string> paths;
  Json::Value data(Json::objectValue);
  data["id"] = el::GetFileIndexID(share);
  data["query"]["load_field"].append(QUIX::CONTENT_EXTRACT::QUIXMDPath);
  data["size"] = kListPageSize;
  {
    data["query"]["qsl"]["term"][QUIX::CONTENT_EXTRACT::QUIXMDPath] = dir;
    data["from"] = 0;
    Json::Value res;
    el::SendRequest(res, Command("document_get_by_query", data));
    if (res["data"].isArray() && !res["data"].empty()) paths.insert(dir);
  }
  data["query"]["qsl"] = Json::Value(Json::objectValue);
  data["query"]["qsl"]["prefix"][QUIX::CONTENT_EXTRACT::QUIXMDPath] = dir + "/";
  for (unsigned int from = 0;; from += kListPageSize) {
    data["from"] = from;
    Json::Value res;
    el::SendRequest(res, Command("document_get_by_query", data));
    const Json::Value& hits = res["data"];
    ORVANE_THROW_IF(!hits.isArray(), kErrNoQueryData, JsonToString(res));
    for (const auto& hit : hits) {
      const Json::Value& p = hit[QUIX::CONTENT_EXTRACT::QUIXMDPath];
      if (p.isString()) paths.insert(p.asString());
    }
    if (hits.size() < kListPageSize) break;
  }
  return paths;
}

void Indexer::Crawl(const std::string& root, const CrawlMode& mode, bool reconcile) {
  std::unordered_set<std::string> stale;
  if (reconcile) stale = ListDocuments(share_, root);
  Batch batch(this);
  struct stat st;
  if (TooLong(root)) NoteLongPath(root);
  if (lstat(root.c_str(), &st) == 0) {
    if (S_ISDIR(st.st_mode)) {
      CrawlDir(root, st.st_dev, mode, batch, reconcile ? &stale : nullptr);
    } else if (S_ISREG(st.st_mode)) {
      if (folders_->GetMostSuitableCfg(root) && fileindex::CanFullPathBeIndexed(root)) {
        stale.erase(root);
        batch.Upsert(root, folders_->IsFullPathNeedMeta(root));
      }
    }
  }
  // A stopped crawl saw only part of the tree: what it did not reach is not stale. What it
  // gathered but did not send yet is dropped too: its operation stays queued and crawls again.
  if (Stopping()) return;
  if (reconcile) {
    for (const auto& path : stale) batch.Delete(path);
  }
  batch.Flush();
}

void Indexer::Reconcile(const std::string& root) {
  if (observer_) observer_(root, ReconcileCounts(), false);
  Batch batch(this);
  ReconcileBatch sink(this, &batch);
  EngineEntries index(share_, root);
  std::function<void(const ReconcileCounts&)> progress;
  if (observer_) progress = [&](const ReconcileCounts& counts) { observer_(root, counts, false); };
  Reconciler reconciler(*folders_, stop_, progress);
  // A stopped reconciliation sends nothing more: its operation stays queued and runs again.
  if (!reconciler.Run(root, index, sink)) return;
  batch.Flush();
  const ReconcileCounts& counts = reconciler.counts();
  Log(LOG_INFO,
      "fileindexd: reconciled %s: %llu entries compared, %llu added, %llu removed, %llu "
      "refreshed",
      root.c_str(), static_cast<unsigned long long>(counts.compared),
      static_cast<unsigned long long>(counts.added),
      static_cast<unsigned long long>(counts.removed),
      static_cast<unsigned long long>(counts.refreshed));
  if (observer_) observer_(root, counts, true);
}

void Indexer::CrawlDir(const std::string& dir, dev_t dev, const CrawlMode& mode, Batch& batch,
                       std::unordered_set<std::string>* stale) {
  if (Stopping()) return;
  // The rules are judged once here for every entry of the directory.
  const bool indexable = folders_->GetMostSuitableCfg(dir) && fileindex::CanFullPathBeIndexed(dir);
  if (!indexable && !HasFolderBelow(dir)) return;

  DIR* raw = opendir(dir.c_str());
  if (raw == nullptr) {
    Log(LOG_WARNING, "fileindexd: cannot read %s: %s", dir.c_str(), strerror(errno));
    // Unreadable now is not gone: keep what the index holds below it.
    if (stale != nullptr) {
      for (auto it = stale->begin(); it != stale->end();) {
        it = (*it == dir || IsSubPath(*it, dir)) ? stale->erase(it) : std::next(it);
      }
    }
    return;
  }
  std::unique_ptr<DIR, int (*)(DIR*)> closer(raw, closedir);
  if (indexable) {
    const bool missing = stale != nullptr && stale->count(dir) == 0;
    if (stale != nullptr) stale->erase(dir);
    if (mode.all || missing) batch.Upsert(dir, false);
  }
  std::vector<std::string> subdirs;
  while (struct dirent* entry = readdir(raw)) {
    // Per entry rather than per directory: one flat directory may hold most of a share.
    if (Stopping()) return;
    const std::string name = entry->d_name;
    if (name == "." || name == "..") continue;
    const std::string path = dir + "/" + name;
    if (TooLong(path)) {
      // Neither it nor anything below it can be reached by name; a file of a folder the rules
      // leave out would not have been indexed anyway.
      const bool may_be_dir = entry->d_type == DT_DIR || entry->d_type == DT_UNKNOWN;
      if (indexable || may_be_dir) NoteLongPath(path);
      continue;
    }
    // Looked up in the directory already open rather than by its whole path: one read of the
    // attributes serves the type check and the document.
    struct statx st;
    if (statx(dirfd(raw), entry->d_name, AT_SYMLINK_NOFOLLOW, STATX_BASIC_STATS | STATX_BTIME,
              &st) != 0) {
      continue;
    }
    if (S_ISDIR(st.stx_mode)) {
      // Other file systems mounted below are not ours to index.
      if (makedev(st.stx_dev_major, st.stx_dev_minor) == dev) subdirs.push_back(path);
      continue;
    }
    if (!indexable || !S_ISREG(st.stx_mode)) continue;
    if (fileindex::IsSystemPreservedFileName(name)) continue;
    bool missing = false;
    if (stale != nullptr) missing = stale->erase(path) == 0;
    if (mode.all || missing || KindSwitched(mode, path)) {
      batch.Upsert(path, folders_->IsFullPathNeedMeta(path), &st);
    }
  }
  closer.reset();
  for (const auto& sub : subdirs) CrawlDir(sub, dev, mode, batch, stale);
}

bool Indexer::HasFolderBelow(const std::string& dir) const {
  for (const auto& folder : folders_->folders()) {
    const std::string full = folder->GetFullPath();
    if (full != dir && IsSubPath(full, dir)) return true;
  }
  return false;
}

bool Indexer::KindSwitched(const CrawlMode& mode, const std::string& path) const {
  if (!mode.kinds.isObject()) return false;
  const char* setting = fileindex::GetFileTypeSetting(fileindex::GetFileTypeByFullPath(path));
  if (setting == nullptr) return false;
  const Json::Value& on = mode.kinds[setting];
  return on.isBool() && on.asBool();
}

}  // namespace fileindexd
}  // namespace orvane
