// Thin RAII owners of a SQLite connection and a prepared statement, turning every failed call
// into a StoreError that carries SQLite's own message and result code.
// A Db and its Stmts belong to one thread at a time; neither is copyable.
#ifndef ORVANE_DAEMONS_QUIXELASTICD_SQLITE_UTIL_HPP_
#define ORVANE_DAEMONS_QUIXELASTICD_SQLITE_UTIL_HPP_

#include <sqlite3.h>

#include <cstdint>
#include <map>
#include <stdexcept>
#include <string>

namespace orvane {
namespace elasticd {

// A failed storage call. `sqlite_code` is the extended result code (SQLITE_FULL, SQLITE_CORRUPT..).
class StoreError : public std::runtime_error {
 public:
  StoreError(int sqlite_code, const std::string& what)
      : std::runtime_error(what), sqlite_code(sqlite_code) {}
  int sqlite_code;
  // Whether the database file itself is damaged (as opposed to full, locked or unreadable).
  bool IsCorruption() const {
    const int primary = sqlite_code & 0xff;
    return primary == SQLITE_CORRUPT || primary == SQLITE_NOTADB;
  }
};

class Stmt;

// The name of a VFS that behaves as the default "unix" one except that it takes a database's
// name as given instead of resolving its symbolic links. Stores opened as
// "/proc/self/fd/<folder descriptor>/index.db" then reach their files (the database, its log
// and shared-memory index) through the folder they verified, whatever the folder's path names
// by now. Registered on first use; safe from any thread.
const char* FolderFdVfs();

class Db {
 public:
  Db() = default;
  ~Db();
  Db(const Db&) = delete;
  Db& operator=(const Db&) = delete;

  // Opens (creating when `create`) the database file; throws StoreError. `vfs` names the
  // SQLite VFS (nullptr: the default one).
  void Open(const std::string& file, bool create, bool read_only, const char* vfs = nullptr);
  void Close();
  bool IsOpen() const { return db_ != nullptr; }
  sqlite3* get() const { return db_; }

  void Exec(const std::string& sql);
  // Exec() of a constant statement run often (savepoints), prepared once per connection.
  void ExecCached(const char* sql);
  int64_t LastInsertRowid() const { return sqlite3_last_insert_rowid(db_); }
  int Changes() const { return sqlite3_changes(db_); }
  [[noreturn]] void Fail(int rc, const std::string& context) const;

 private:
  sqlite3* db_ = nullptr;
  std::map<const char*, sqlite3_stmt*> cached_;
};

class Stmt {
 public:
  Stmt(Db& db, const std::string& sql);
  ~Stmt();
  Stmt(const Stmt&) = delete;
  Stmt& operator=(const Stmt&) = delete;

  Stmt& Bind(int index, const std::string& value);
  Stmt& Bind(int index, int64_t value);
  Stmt& Bind(int index, double value);
  Stmt& BindNull(int index);
  // True while a row is available; false when done. Throws on failure.
  bool Step();
  // Steps to completion (statements that return no rows).
  void Run();
  void Reset();

  bool IsNull(int col) const { return sqlite3_column_type(stmt_, col) == SQLITE_NULL; }
  bool IsInt(int col) const { return sqlite3_column_type(stmt_, col) == SQLITE_INTEGER; }
  int64_t Int(int col) const { return sqlite3_column_int64(stmt_, col); }
  double Double(int col) const { return sqlite3_column_double(stmt_, col); }
  std::string Text(int col) const;

 private:
  Db& db_;
  sqlite3_stmt* stmt_ = nullptr;
};

// RAII transaction: BEGIN IMMEDIATE on construction, ROLLBACK unless Commit() was called.
class Transaction {
 public:
  explicit Transaction(Db& db);
  ~Transaction();
  Transaction(const Transaction&) = delete;
  Transaction& operator=(const Transaction&) = delete;
  void Commit();

 private:
  Db& db_;
  bool open_ = true;
};

// RAII savepoint: released by Release(), rolled back to (and released) otherwise.
class Savepoint {
 public:
  explicit Savepoint(Db& db);
  ~Savepoint();
  Savepoint(const Savepoint&) = delete;
  Savepoint& operator=(const Savepoint&) = delete;
  void Release();

 private:
  Db& db_;
  bool open_ = true;
};

}  // namespace elasticd
}  // namespace orvane

#endif  // ORVANE_DAEMONS_QUIXELASTICD_SQLITE_UTIL_HPP_
