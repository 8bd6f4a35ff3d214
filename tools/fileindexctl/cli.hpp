// The pieces every fileindexctl command shares: argument parsing, the two output forms (aligned
// tables for people, JSON for scripts), readable sizes and dates, and the one-line error report.
// Plain values; not thread-safe.
#ifndef ORVANE_TOOLS_FILEINDEXCTL_CLI_HPP_
#define ORVANE_TOOLS_FILEINDEXCTL_CLI_HPP_

#include <json/json.h>

#include <cstdint>
#include <map>
#include <ostream>
#include <set>
#include <stdexcept>
#include <string>
#include <vector>

#include "common/error.hpp"

namespace orvane {
namespace ctl {

// A mistake in the command line; reported with the command's usage and exit status 2.
class UsageError : public std::runtime_error {
 public:
  using std::runtime_error::runtime_error;
};

// Thrown by a command that has printed its whole result but ends with another exit status than
// 0 (the doctor's 1 when something would stop indexing).
struct ExitWith {
  int status;
};

// Options ("--name value", "--name=value", "--flag") and positional arguments, in order.
class Args {
 public:
  // `flags` are the options that take no value; every other "--x" takes one.
  Args(const std::vector<std::string>& argv, const std::set<std::string>& flags);

  const std::vector<std::string>& positional() const { return positional_; }
  // The i-th positional argument; UsageError naming `what` when it is missing.
  const std::string& At(size_t i, const std::string& what) const;
  bool Has(const std::string& option) const { return options_.count(option) != 0; }
  std::string Get(const std::string& option, const std::string& fallback = "") const;
  // A whole number; UsageError when it is not one.
  long long GetInt(const std::string& option, long long fallback) const;
  // "on"/"off" (also yes/no, true/false, 1/0); UsageError otherwise.
  bool GetSwitch(const std::string& option, bool fallback) const;
  // UsageError for any option outside `known` or more positionals than `max_positional`.
  void Check(const std::set<std::string>& known, size_t max_positional) const;

 private:
  std::vector<std::string> positional_;
  std::map<std::string, std::string> options_;
};

// Column-aligned text for people.
class Table {
 public:
  explicit Table(std::vector<std::string> header) : rows_{std::move(header)} {}
  void Add(std::vector<std::string> row) { rows_.push_back(std::move(row)); }
  bool empty() const { return rows_.size() == 1; }
  void Print(std::ostream& out) const;

 private:
  std::vector<std::vector<std::string>> rows_;
};

// "1.5 MiB", "912 B".
std::string HumanSize(uint64_t bytes);
// "2024-05-06 07:08" in local time; "-" for 0.
std::string HumanTime(int64_t seconds);
// "yes"/"no".
std::string YesNo(bool value);
// A date "YYYY-MM-DD" or "YYYY-MM-DD HH:MM" (local time), or seconds since the epoch.
int64_t ParseTime(const std::string& text);
// "10k", "4M", "2G" or plain bytes.
uint64_t ParseSize(const std::string& text);

// What an error code means to an administrator, and what to do about it.
// An error the search engine answered with: it was reached, and its message says what to do
// (a busy engine, a search over its time budget). Thrown as the engine's error, 913.
class EngineRefusal : public Error {
 public:
  EngineRefusal(int engine_code, const std::string& msg)
      : Error(kErrElastic, msg), engine_code(engine_code) {}

  int engine_code;
};

struct ErrorAdvice {
  std::string meaning;
  std::string hint;
};
ErrorAdvice AdviceFor(int code);
// The reason inside an error message "..., reason=[...]", or the whole message.
std::string ReasonOf(const std::string& message);

}  // namespace ctl
}  // namespace orvane

#endif  // ORVANE_TOOLS_FILEINDEXCTL_CLI_HPP_
