#include "test/faults.hpp"

#include <map>
#include <mutex>
#include <optional>

namespace orvane {
namespace platform {
namespace {

struct Armed {
  Fault fault;
  int skip;
  int times;
};

struct Table {
  std::mutex mu;
  std::multimap<std::string, Armed> armed;
  std::map<std::string, int> calls;
};

Table& GetTable() {
  static Table* table = new Table();  // never destroyed: platform calls may run during exit
  return *table;
}

std::optional<Fault> Lookup(const char* name) {
  Table& table = GetTable();
  std::lock_guard<std::mutex> lock(table.mu);
  ++table.calls[name];
  auto range = table.armed.equal_range(name);
  for (auto it = range.first; it != range.second; ++it) {
    Armed& armed = it->second;
    if (armed.skip > 0) {
      --armed.skip;
      continue;
    }
    Fault fault = armed.fault;
    if (armed.times > 0 && --armed.times == 0) table.armed.erase(it);
    return fault;
  }
  return std::nullopt;
}

// Installed once and left in place: a platform call on another thread may be in the hook.
void Install() { SetFaultHook(&Lookup); }

}  // namespace

void ArmFault(const std::string& name, const Fault& fault, int skip, int times) {
  Table& table = GetTable();
  {
    std::lock_guard<std::mutex> lock(table.mu);
    table.armed.emplace(name, Armed{fault, skip, times});
  }
  Install();
}

void ClearFaults() {
  Table& table = GetTable();
  std::lock_guard<std::mutex> lock(table.mu);
  table.armed.clear();
  table.calls.clear();
}

int CallCount(const std::string& name) {
  Table& table = GetTable();
  std::lock_guard<std::mutex> lock(table.mu);
  auto it = table.calls.find(name);
  return it == table.calls.end() ? 0 : it->second;
}

ScopedFaults::ScopedFaults() {
  ClearFaults();
  Install();
}

ScopedFaults::~ScopedFaults() { ClearFaults(); }

}  // namespace platform
}  // namespace orvane
