#include "daemons/quixelasticd/sqlite_util.hpp"

#include <sys/stat.h>
#include <syslog.h>

#include <cstring>
#include <mutex>

#include "common/log.hpp"

namespace orvane {
namespace elasticd {

namespace {

constexpr const char* kFolderFdVfsName = "orvane-folder-fd";

// The default VFS resolves every link of a name textually, "/proc/self/fd/N" included, which
// would turn the name back into the folder's path and undo the descriptor's protection. Names
// here are absolute and clean, so they are kept as they are; a database file that is itself a
// link is reported so that SQLITE_OPEN_NOFOLLOW refuses it.
int FullPathnameAsGiven(sqlite3_vfs*, const char* name, int out_size, char* out) {
  const size_t n = std::strlen(name);
  if (name[0] != '/' || n + 1 > static_cast<size_t>(out_size)) return SQLITE_CANTOPEN;
  std::memcpy(out, name, n + 1);
  struct stat st;
  if (lstat(name, &st) == 0 && S_ISLNK(st.st_mode)) return SQLITE_OK_SYMLINK;
  return SQLITE_OK;
}

}  // namespace

const char* FolderFdVfs() {
  static std::once_flag once;
  static sqlite3_vfs vfs;
  std::call_once(once, [] {
    sqlite3_vfs* unix_vfs = sqlite3_vfs_find("unix");
    if (unix_vfs == nullptr) unix_vfs = sqlite3_vfs_find(nullptr);
    // A copy keeps the default's methods and its private data (which its open and lock code
    // read through the VFS pointer); only the name and the path resolution differ.
    vfs = *unix_vfs;
    vfs.pNext = nullptr;
    vfs.zName = kFolderFdVfsName;
    vfs.xFullPathname = FullPathnameAsGiven;
    const int rc = sqlite3_vfs_register(&vfs, 0);
    if (rc != SQLITE_OK) Log(LOG_ERR, "cannot register the SQLite VFS: %s", sqlite3_errstr(rc));
  });
  return kFolderFdVfsName;
}

Db::~Db() { Close(); }

void Db::Open(const std::string& file, bool create, bool read_only, const char* vfs) {
  Close();
  int flags = SQLITE_OPEN_NOMUTEX;
  if (vfs != nullptr) flags |= SQLITE_OPEN_NOFOLLOW;
  flags |= read_only ? SQLITE_OPEN_READONLY : SQLITE_OPEN_READWRITE;
  if (create && !read_only) flags |= SQLITE_OPEN_CREATE;
  const int rc = sqlite3_open_v2(file.c_str(), &db_, flags, vfs);
  if (rc != SQLITE_OK) {
    const std::string msg = db_ != nullptr ? sqlite3_errmsg(db_) : sqlite3_errstr(rc);
    Close();
    throw StoreError(rc, "open " + file + ": " + msg);
  }
  sqlite3_extended_result_codes(db_, 1);
  // A larger lookaside pool serves the many small allocations of statements and full-text
  // inserts without going to malloc.
  sqlite3_db_config(db_, SQLITE_DBCONFIG_LOOKASIDE, nullptr, 512, 1024);
  // Writers of one index are serialised by the daemon; the timeout only covers readers that
  // hold the WAL briefly during a checkpoint.
  sqlite3_busy_timeout(db_, 5000);
}

void Db::Close() {
  if (db_ == nullptr) return;
  for (auto& [sql, stmt] : cached_) sqlite3_finalize(stmt);
  cached_.clear();
  // close_v2 defers the close until the last statement is finalised, so an owner that outlives
  // a Stmt by mistake cannot leak the handle.
  sqlite3_close_v2(db_);
  db_ = nullptr;
}

void Db::Exec(const std::string& sql) {
  char* err = nullptr;
  const int rc = sqlite3_exec(db_, sql.c_str(), nullptr, nullptr, &err);
  if (rc != SQLITE_OK) {
    const std::string msg = err != nullptr ? err : sqlite3_errstr(rc);
    sqlite3_free(err);
    throw StoreError(sqlite3_extended_errcode(db_), sql.substr(0, 60) + ": " + msg);
  }
}

void Db::ExecCached(const char* sql) {
  sqlite3_stmt*& stmt = cached_[sql];
  if (stmt == nullptr) {
    const int rc = sqlite3_prepare_v2(db_, sql, -1, &stmt, nullptr);
    if (rc != SQLITE_OK) {
      cached_.erase(sql);
      Fail(rc, std::string("prepare ") + sql);
    }
  }
  const int rc = sqlite3_step(stmt);
  sqlite3_reset(stmt);
  if (rc != SQLITE_DONE && rc != SQLITE_ROW) Fail(rc, sql);
}

void Db::Fail(int rc, const std::string& context) const {
  throw StoreError(db_ != nullptr ? sqlite3_extended_errcode(db_) : rc,
                   context + ": " + (db_ != nullptr ? sqlite3_errmsg(db_) : sqlite3_errstr(rc)));
}

Stmt::Stmt(Db& db, const std::string& sql) : db_(db) {
  const int rc = sqlite3_prepare_v2(db.get(), sql.c_str(), static_cast<int>(sql.size()), &stmt_,
                                    nullptr);
  if (rc != SQLITE_OK) db.Fail(rc, "prepare " + sql.substr(0, 60));
}

Stmt::~Stmt() { sqlite3_finalize(stmt_); }

Stmt& Stmt::Bind(int index, const std::string& value) {
  const int rc = sqlite3_bind_text(stmt_, index, value.data(), static_cast<int>(value.size()),
                                   SQLITE_TRANSIENT);
  if (rc != SQLITE_OK) db_.Fail(rc, "bind");
  return *this;
}

Stmt& Stmt::Bind(int index, int64_t value) {
  const int rc = sqlite3_bind_int64(stmt_, index, value);
  if (rc != SQLITE_OK) db_.Fail(rc, "bind");
  return *this;
}

Stmt& Stmt::Bind(int index, double value) {
  const int rc = sqlite3_bind_double(stmt_, index, value);
  if (rc != SQLITE_OK) db_.Fail(rc, "bind");
  return *this;
}

Stmt& Stmt::BindNull(int index) {
  const int rc = sqlite3_bind_null(stmt_, index);
  if (rc != SQLITE_OK) db_.Fail(rc, "bind");
  return *this;
}

bool Stmt::Step() {
  const int rc = sqlite3_step(stmt_);
  if (rc == SQLITE_ROW) return true;
  if (rc == SQLITE_DONE) return false;
  db_.Fail(rc, "step");
}

void Stmt::Run() {
  while (Step()) {
  }
  Reset();
}

void Stmt::Reset() {
  sqlite3_reset(stmt_);
  sqlite3_clear_bindings(stmt_);
}

std::string Stmt::Text(int col) const {
  const unsigned char* text = sqlite3_column_text(stmt_, col);
  if (text == nullptr) return std::string();
  return std::string(reinterpret_cast<const char*>(text), sqlite3_column_bytes(stmt_, col));
}

Transaction::Transaction(Db& db) : db_(db) { db_.Exec("BEGIN IMMEDIATE"); }

Transaction::~Transaction() {
  // SQLite may already have rolled back on its own (a full disk, an I/O error).
  if (!open_ || sqlite3_get_autocommit(db_.get()) != 0) return;
  char* err = nullptr;
  if (sqlite3_exec(db_.get(), "ROLLBACK", nullptr, nullptr, &err) != SQLITE_OK) {
    Log(3, "rollback failed: %s", err != nullptr ? err : "?");
  }
  sqlite3_free(err);
}

void Transaction::Commit() {
  db_.Exec("COMMIT");
  open_ = false;
}

Savepoint::Savepoint(Db& db) : db_(db) { db_.ExecCached("SAVEPOINT sub"); }

Savepoint::~Savepoint() {
  if (!open_ || sqlite3_get_autocommit(db_.get()) != 0) return;
  try {
    db_.ExecCached("ROLLBACK TO sub");
    db_.ExecCached("RELEASE sub");
  } catch (const StoreError& e) {
    Log(3, "rollback to savepoint failed: %s", e.what());
  }
}

void Savepoint::Release() {
  db_.ExecCached("RELEASE sub");
  open_ = false;
}

}  // namespace elasticd
}  // namespace orvane
