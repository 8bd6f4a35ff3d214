#include "common/comm.hpp"

#include <syslog.h>
#include <unistd.h>

#include <cerrno>
#include <string>

#include "common/env.hpp"
#include "common/error.hpp"
#include "common/json_util.hpp"
#include "common/log.hpp"
#include "common/notify.hpp"
#include "common/root.hpp"
#include "platform/daemon_sock.hpp"

namespace orvane {
namespace {

constexpr int kSocketWaitRetries = 31;
constexpr int64_t kSecond = 1000000;
constexpr int64_t kNotReadySleep = 30 * kSecond;
constexpr unsigned kBusyRetriesBeforeNotify = 10;

bool IsBusy(int code) { return code == kCodeOutOfMemory || code == kCodeOverloaded; }
// kCodeIndexDamaged, of the same range, is deliberately not waited out.
bool IsNotReady(int code) {
  return code == kCodeIndexOpening || code == kCodeIndexRecovering || code == kCodeIndexMoving;
}

// A member's text for a log line: strings as they are, anything else as JSON.
std::string MemberText(const Json::Value& value) {
  if (value.isNull()) return "";
  return value.isString() ? value.asString() : JsonToString(value);
}

// The request as the wire carries it: the compact text, which keeps every byte of a string
// (control characters escaped, other bytes as they are), so paths that are not valid UTF-8
// survive.
struct WireRequest {
  const Json::Value& value;
  std::string toString() const { return JsonToString(value); }
};

void SendWhole(quixdaemon::DomainSockConnection& conn, const WireRequest& req) {
  ORVANE_THROW_IF_IN("SendRequestImpl", !conn.Send(req.toString()), kErrElastic, "Send failed");
}

// A reply as the exchange reads it: a text that parses to anything but an object cannot carry
// "success" and does not count as parsed (member access on a non-object is a logic error in the
// JSON library). What was parsed is kept for the error message.
class Reply : public JsonValue {
 public:
  bool fromString(const std::string& text) { return JsonValue::fromString(text) && isObject(); }
};

}  // namespace

void SendRequestImpl(Json::Value& res_out, const Json::Value& req) {
  const std::string sock_path = RootedPath(kElasticdSockPath);
  Env* env = Env::Current();
  const int saved_errno = errno;
  // The daemon may be starting: give its socket half a minute to appear. After that the
  // connect below fails and says so.
  for (int failures = 1; access(sock_path.c_str(), F_OK) != 0; ++failures) {
    if (failures > kSocketWaitRetries) break;
    ORVANE_LOG(LOG_ERR, "elastic socket is not ready, retry ... %d", failures);
    env->SleepMicros(kSecond);
  }
  errno = saved_errno;

  quixdaemon::DomainSockConnection conn(sock_path);
  ORVANE_THROW_IF(!conn.Connect(kElasticdConnectTimeout), kErrElastic, "Connect failed");
  SendWhole(conn, WireRequest{req});

  std::string resp_raw;
  Reply res;
  ORVANE_THROW_IF(!conn.Recv(resp_raw) || !res.fromString(resp_raw) || !res.isMember("success") ||
                      !res["success"].isBool(),
                  kErrElastic, "Recv failed, res=" + res.toString());
  conn.Disconnect();

  const Json::Value& reply = res;
  if (!reply["success"].asBool()) {
    int code = 0;
    std::string msg;
    GetJsonValue(code, reply["error"], "code", true);
    GetJsonValue(msg, reply["error"], "msg", true);
    throw Error(static_cast<ErrorCode>(code), "Request failed, msg=" + msg);
  }

  const bool compound = req.isObject() && req.isMember("compound");
  const Json::Value& has_fail = reply["has_fail"];
  if (compound && has_fail.isBool() && has_fail.asBool() && reply["data"].isArray()) {
    const Json::Value& data = reply["data"];
    for (Json::ArrayIndex i = 0; i < data.size(); ++i) {
      const Json::Value& entry = data[i];
      if (!entry.isObject() || !entry["success"].isBool() || entry["success"].asBool()) continue;
      int code = 0;
      std::string msg;
      GetJsonValue(code, entry["error"], "code", true);
      GetJsonValue(msg, entry["error"], "msg", false);
      // A busy daemon dropped the request: the whole of it has to be sent again.
      if (IsBusy(code)) throw Error(static_cast<ErrorCode>(code), msg);
      const Json::Value& subs = req["compound"];
      const std::string sub_text =
          JsonToString(subs.isArray() ? subs[i] : Json::Value::nullSingleton());
      ORVANE_LOG_FAILED("Compound failed: %s (%d) %s", sub_text.c_str(), code, msg.c_str());
    }
  }
  res_out.swap(res);
}

namespace fileindex {
namespace elastic {

void SendRequest(Json::Value& res, const Json::Value& req) {
  Env* env = Env::Current();
  unsigned busy_retries = 0;
  bool notified = false;
  for (;;) {
    try {
      SendRequestImpl(res, req);
      return;
    } catch (const Error& e) {
      if (IsNotReady(e.code)) {
        ORVANE_LOG(LOG_ERR, "DB is not good yet, retry... (Error Code: %d)",
                   static_cast<int>(e.code));
        env->SleepMicros(kNotReadySleep);
        continue;
      }
      if (!IsBusy(e.code)) throw Error(e);
      const Json::Value& request = req;
      const std::string command = request.isObject() ? MemberText(request["command"]) : "";
      const std::string db =
          request.isObject() && request["data"].isObject() ? MemberText(request["data"]["id"]) : "";
      ORVANE_LOG(LOG_ERR, "Retry[%u] since quixelasticd is busy. Command: %s, db: %s", busy_retries,
                 command.c_str(), db.c_str());
      if (busy_retries + 1 > kBusyRetriesBeforeNotify && !notified) {
        NotifyLackOfMemory();
        notified = true;
      }
      env->SleepMicros((900 + 60 * static_cast<int64_t>(env->Rand() % 5)) * kSecond);
      ++busy_retries;
    }
  }
}

void SendRequest(const Json::Value& req) {
  Json::Value res;
  SendRequest(res, req);
}

}  // namespace elastic
}  // namespace fileindex
}  // namespace orvane
