// Thin RAII owners of a PostgreSQL connection, a result and a transaction, and a pool of
// connections that reconnects with back-off when the server goes away. Every value travels as a
// bound parameter; failures become StoreErrors (SQLITE_IOERR when the server cannot be reached,
// so the caller answers "store unavailable" and the indexer keeps its batch).
// A PgConn belongs to one thread at a time; PgPool is thread-safe.
#ifndef ORVANE_DAEMONS_QUIXELASTICD_PG_UTIL_HPP_
#define ORVANE_DAEMONS_QUIXELASTICD_PG_UTIL_HPP_

#include <libpq-fe.h>

#include <cstdint>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "daemons/quixelasticd/sqlite_util.hpp"

namespace orvane {
namespace elasticd {

// The server could not be reached or dropped the connection: nothing of the request was
// committed, and the same request may be sent again once it is back.
class StoreUnavailableError : public StoreError {
 public:
  explicit StoreUnavailableError(const std::string& what) : StoreError(SQLITE_IOERR, what) {}
};

// The bound values of one statement, in the order of its $n marks. Texts must be valid UTF-8
// without NUL; bytes go in binary form and may hold anything.
class PgParams {
 public:
  PgParams& Text(std::string v);
  PgParams& Bytes(std::string v);
  PgParams& Int(int64_t v);
  PgParams& Real(double v);
  PgParams& Bool(bool v);
  PgParams& Null();
  size_t size() const { return values_.size(); }

 private:
  friend class PgConn;
  std::vector<std::optional<std::string>> values_;
  std::vector<int> binary_;
};

class PgResult {
 public:
  PgResult() = default;
  explicit PgResult(PGresult* r) : r_(r, &PQclear) {}
  int rows() const { return r_ ? PQntuples(r_.get()) : 0; }
  bool IsNull(int row, int col) const { return PQgetisnull(r_.get(), row, col) != 0; }
  std::string Text(int row, int col) const;
  // A bytea column, read back to its bytes.
  std::string Bytes(int row, int col) const;
  int64_t Int(int row, int col) const;
  double Real(int row, int col) const;
  bool Bool(int row, int col) const;
  // Rows changed by an INSERT, UPDATE or DELETE.
  int64_t Changed() const;

 private:
  std::shared_ptr<PGresult> r_;
};

class PgConn {
 public:
  // Connects; throws StoreUnavailableError naming the server and what to do.
  explicit PgConn(const std::string& conninfo);
  ~PgConn() = default;
  PgConn(const PgConn&) = delete;
  PgConn& operator=(const PgConn&) = delete;

  // Runs one statement. Throws StoreUnavailableError when the connection is lost,
  // StoreError(SQLITE_INTERRUPT) when it was cancelled, StoreError otherwise.
  PgResult Exec(const std::string& sql, const PgParams& params = PgParams());
  // Exec() of a statement run often (writes), prepared once per connection. Not for searches:
  // a prepared statement's plan does not see the values of its patterns.
  PgResult ExecCached(const std::string& sql, const PgParams& params);
  // Runs statements without parameters (schema scripts).
  void Script(const std::string& sql);
  bool Healthy() const { return PQstatus(conn_.get()) == CONNECTION_OK; }
  bool InTransaction() const { return PQtransactionStatus(conn_.get()) != PQTRANS_IDLE; }
  // Asks the server to stop the statement this connection runs; safe from another thread.
  void Cancel();
  PGconn* get() const { return conn_.get(); }

 private:
  static constexpr size_t kMaxPrepared = 64;
  PgResult Run(const char* prepared, const std::string& sql, const PgParams& params);
  [[noreturn]] void Fail(const std::string& context, PGresult* r);
  std::map<std::string, std::string> prepared_;  // statement text -> its name
  std::unique_ptr<PGconn, void (*)(PGconn*)> conn_{nullptr, &PQfinish};
  std::unique_ptr<PGcancel, void (*)(PGcancel*)> cancel_{nullptr, &PQfreeCancel};
  std::mutex cancel_mu_;
};

// BEGIN on construction, ROLLBACK unless Commit() was called (a lost connection has nothing to
// roll back).
class PgTxn {
 public:
  explicit PgTxn(PgConn& conn);
  ~PgTxn();
  PgTxn(const PgTxn&) = delete;
  PgTxn& operator=(const PgTxn&) = delete;
  void Commit();

 private:
  PgConn& conn_;
  bool open_ = true;
};

// Connections to one server, handed out one per reader and kept for reuse. When connecting
// fails, further attempts wait a back-off (doubling from kMinBackoffMicros to
// kMaxBackoffMicros, reset by a success) and fail at once in between, so a server that is down
// costs the daemon one connection attempt per back-off and not one per request.
class PgPool {
 public:
  static constexpr int64_t kMinBackoffMicros = 100 * 1000;
  static constexpr int64_t kMaxBackoffMicros = 5 * 1000 * 1000;

  // `conninfo`: a libpq connection string; `max_idle`: connections kept between uses.
  PgPool(std::string conninfo, size_t max_idle);
  const std::string& conninfo() const { return conninfo_; }

  // A healthy connection; throws StoreUnavailableError.
  std::unique_ptr<PgConn> Take();
  // Keeps `conn` for the next Take() when it is healthy and idle, else closes it.
  void GiveBack(std::unique_ptr<PgConn> conn);

  // A connection taken for one scope.
  class Lease {
   public:
    explicit Lease(PgPool& pool) : pool_(pool), conn_(pool.Take()) {}
    ~Lease() { pool_.GiveBack(std::move(conn_)); }
    Lease(const Lease&) = delete;
    Lease& operator=(const Lease&) = delete;
    PgConn& operator*() { return *conn_; }
    PgConn* operator->() { return conn_.get(); }

   private:
    PgPool& pool_;
    std::unique_ptr<PgConn> conn_;
  };

 private:
  const std::string conninfo_;
  const size_t max_idle_;
  std::mutex mu_;
  std::vector<std::unique_ptr<PgConn>> idle_;
  int64_t retry_at_ = 0;  // monotonic micros before which no attempt is made
  int64_t backoff_ = 0;
  std::string last_failure_;
};

// A text value as an element of an array literal ("{...}"): quoted, with quotes and
// backslashes escaped.
std::string PgArrayElement(const std::string& text);

}  // namespace elasticd
}  // namespace orvane

#endif  // ORVANE_DAEMONS_QUIXELASTICD_PG_UTIL_HPP_
