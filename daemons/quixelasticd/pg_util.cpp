#include "daemons/quixelasticd/pg_util.hpp"

#include <syslog.h>

#include <algorithm>
#include <cstdlib>
#include <cstring>

#include "common/env.hpp"
#include "common/log.hpp"

namespace orvane {
namespace elasticd {

namespace {

// SQLSTATE classes of a server that went away or is going: the statement may be sent again.
bool IsUnavailable(const char* state) {
  if (state == nullptr) return true;           // no answer at all
  return std::strncmp(state, "08", 2) == 0 ||  // connection exception
         std::strcmp(state, "57P01") == 0 ||   // admin shutdown
         std::strcmp(state, "57P02") == 0 ||   // crash shutdown
         std::strcmp(state, "57P03") == 0 ||   // cannot connect now (starting up)
         std::strcmp(state, "53300") == 0;     // too many connections
}

std::string FirstLine(const char* text) {
  std::string s = text == nullptr ? "" : text;
  while (!s.empty() && (s.back() == '\n' || s.back() == ' ')) s.pop_back();
  return s;
}

}  // namespace

PgParams& PgParams::Text(std::string v) {
  values_.emplace_back(std::move(v));
  binary_.push_back(0);
  return *this;
}

PgParams& PgParams::Bytes(std::string v) {
  values_.emplace_back(std::move(v));
  binary_.push_back(1);
  return *this;
}

PgParams& PgParams::Int(int64_t v) { return Text(std::to_string(v)); }

PgParams& PgParams::Real(double v) {
  char buf[40];
  std::snprintf(buf, sizeof(buf), "%.17g", v);
  return Text(buf);
}

PgParams& PgParams::Bool(bool v) { return Text(v ? "t" : "f"); }

PgParams& PgParams::Null() {
  values_.emplace_back(std::nullopt);
  binary_.push_back(0);
  return *this;
}

std::string PgResult::Text(int row, int col) const {
  return std::string(PQgetvalue(r_.get(), row, col),
                     static_cast<size_t>(PQgetlength(r_.get(), row, col)));
}

std::string PgResult::Bytes(int row, int col) const {
  size_t n = 0;
  unsigned char* raw =
      PQunescapeBytea(reinterpret_cast<const unsigned char*>(PQgetvalue(r_.get(), row, col)), &n);
  if (raw == nullptr) throw StoreError(SQLITE_NOMEM, "out of memory reading a result");
  std::string out(reinterpret_cast<const char*>(raw), n);
  PQfreemem(raw);
  return out;
}

int64_t PgResult::Int(int row, int col) const {
  return std::strtoll(PQgetvalue(r_.get(), row, col), nullptr, 10);
}

double PgResult::Real(int row, int col) const {
  return std::strtod(PQgetvalue(r_.get(), row, col), nullptr);
}

bool PgResult::Bool(int row, int col) const { return PQgetvalue(r_.get(), row, col)[0] == 't'; }

int64_t PgResult::Changed() const {
  const char* n = PQcmdTuples(r_.get());
  return n == nullptr || *n == '\0' ? 0 : std::strtoll(n, nullptr, 10);
}

PgConn::PgConn(const std::string& conninfo) {
  conn_.reset(PQconnectdb(conninfo.c_str()));
  if (!conn_ || PQstatus(conn_.get()) != CONNECTION_OK) {
    const std::string why = conn_ ? FirstLine(PQerrorMessage(conn_.get())) : "out of memory";
    throw StoreUnavailableError("cannot connect to the PostgreSQL server (" + conninfo +
                                "): " + why + "; check that it runs and accepts this user");
  }
  // Our statements are short; a client that vanished must not hold locks for long.
  Script("SET client_min_messages = warning; SET idle_in_transaction_session_timeout = '10min'");
  cancel_.reset(PQgetCancel(conn_.get()));
}

void PgConn::Fail(const std::string& context, PGresult* r) {
  const char* state = r != nullptr ? PQresultErrorField(r, PG_DIAG_SQLSTATE) : nullptr;
  std::string msg = r != nullptr ? FirstLine(PQresultErrorMessage(r)) : "";
  if (msg.empty()) msg = FirstLine(PQerrorMessage(conn_.get()));
  const bool lost = PQstatus(conn_.get()) != CONNECTION_OK || IsUnavailable(state);
  const bool cancelled = state != nullptr && std::strcmp(state, "57014") == 0;
  if (r != nullptr) PQclear(r);
  if (lost) {
    throw StoreUnavailableError("the PostgreSQL server went away (" + msg +
                                "): nothing of this request was kept; send it again");
  }
  if (cancelled) throw StoreError(SQLITE_INTERRUPT, "statement cancelled: " + context);
  throw StoreError(SQLITE_ERROR, msg + " (" + context + ")");
}

PgResult PgConn::ExecCached(const std::string& sql, const PgParams& params) {
  auto it = prepared_.find(sql);
  if (it == prepared_.end()) {
    if (prepared_.size() >= kMaxPrepared) return Exec(sql, params);
    const std::string name = "s" + std::to_string(prepared_.size());
    PGresult* r = PQprepare(conn_.get(), name.c_str(), sql.c_str(), 0, nullptr);
    if (r == nullptr || PQresultStatus(r) != PGRES_COMMAND_OK) Fail(sql.substr(0, 80), r);
    PQclear(r);
    it = prepared_.emplace(sql, name).first;
  }
  return Run(it->second.c_str(), sql, params);
}

PgResult PgConn::Exec(const std::string& sql, const PgParams& params) {
  return Run(nullptr, sql, params);
}

PgResult PgConn::Run(const char* prepared, const std::string& sql, const PgParams& params) {
  std::vector<const char*> values;
  std::vector<int> lengths;
  values.reserve(params.size());
  lengths.reserve(params.size());
  for (const auto& v : params.values_) {
    values.push_back(v ? v->data() : nullptr);
    lengths.push_back(v ? static_cast<int>(v->size()) : 0);
  }
  const int n = static_cast<int>(params.size());
  PGresult* r = prepared != nullptr
                    ? PQexecPrepared(conn_.get(), prepared, n, values.data(), lengths.data(),
                                     params.binary_.data(), 0)
                    : PQexecParams(conn_.get(), sql.c_str(), n, nullptr, values.data(),
                                   lengths.data(), params.binary_.data(), 0);
  const ExecStatusType st = r != nullptr ? PQresultStatus(r) : PGRES_FATAL_ERROR;
  if (st != PGRES_COMMAND_OK && st != PGRES_TUPLES_OK) Fail(sql.substr(0, 80), r);
  return PgResult(r);
}

void PgConn::Script(const std::string& sql) {
  PGresult* r = PQexec(conn_.get(), sql.c_str());
  const ExecStatusType st = r != nullptr ? PQresultStatus(r) : PGRES_FATAL_ERROR;
  if (st != PGRES_COMMAND_OK && st != PGRES_TUPLES_OK) Fail(sql.substr(0, 80), r);
  PQclear(r);
}

void PgConn::Cancel() {
  std::lock_guard<std::mutex> lock(cancel_mu_);
  char err[256];
  if (cancel_) PQcancel(cancel_.get(), err, sizeof(err));
}

PgTxn::PgTxn(PgConn& conn) : conn_(conn) { conn_.Script("BEGIN"); }

PgTxn::~PgTxn() {
  if (!open_ || !conn_.Healthy()) return;
  try {
    conn_.Script("ROLLBACK");
  } catch (const StoreError& e) {
    Log(LOG_WARNING, "rollback failed: %s", e.what());
  }
}

void PgTxn::Commit() {
  open_ = false;
  conn_.Script("COMMIT");
}

PgPool::PgPool(std::string conninfo, size_t max_idle)
    : conninfo_(std::move(conninfo)), max_idle_(max_idle) {}

std::unique_ptr<PgConn> PgPool::Take() {
  {
    std::lock_guard<std::mutex> lock(mu_);
    while (!idle_.empty()) {
      std::unique_ptr<PgConn> conn = std::move(idle_.back());
      idle_.pop_back();
      if (conn->Healthy()) return conn;
    }
    const int64_t now = Env::Current()->NowMicros();
    if (now < retry_at_) {
      throw StoreUnavailableError(last_failure_ + " (next attempt in " +
                                  std::to_string((retry_at_ - now) / 1000) + " ms)");
    }
  }
  try {
    auto conn = std::make_unique<PgConn>(conninfo_);
    std::lock_guard<std::mutex> lock(mu_);
    if (backoff_ != 0) Log(LOG_INFO, "the PostgreSQL server is reachable again");
    backoff_ = 0;
    retry_at_ = 0;
    return conn;
  } catch (const StoreUnavailableError& e) {
    std::lock_guard<std::mutex> lock(mu_);
    if (backoff_ == 0) Log(LOG_ERR, "%s", e.what());
    backoff_ = std::min(backoff_ == 0 ? kMinBackoffMicros : backoff_ * 2, kMaxBackoffMicros);
    retry_at_ = Env::Current()->NowMicros() + backoff_;
    last_failure_ = e.what();
    throw;
  }
}

void PgPool::GiveBack(std::unique_ptr<PgConn> conn) {
  if (!conn || !conn->Healthy() || conn->InTransaction()) return;
  std::lock_guard<std::mutex> lock(mu_);
  if (idle_.size() < max_idle_) idle_.push_back(std::move(conn));
}

std::string PgArrayElement(const std::string& text) {
  std::string out = "\"";
  for (char c : text) {
    if (c == '"' || c == '\\') out += '\\';
    out += c;
  }
  return out + "\"";
}

}  // namespace elasticd
}  // namespace orvane
