// Fuzz entry point for queue parsing and tree building: the input is a queue file's text.
// Built as a libFuzzer target with clang and driven by a seeded generator in the unit tests.
// Aborts when the tree's own bookkeeping is inconsistent after a pass.
#include <cstdint>
#include <cstdlib>
#include <string>

#include "common/log.hpp"
#include "fileindex/optree.hpp"

using orvane::fileindex::OP;
using orvane::fileindex::OPTree;

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  static const bool quiet = [] {
    orvane::SetLogSink([](int, const std::string&) {});
    return true;
  }();
  (void)quiet;
  OPTree tree("/dev/null");
  const std::string text(reinterpret_cast<const char*>(data), size);
  for (size_t begin = 0; begin <= text.size() && !tree.crashed;) {
    size_t end = text.find('\n', begin);
    if (end == std::string::npos) end = text.size();
    if (end > begin || end < text.size()) tree.InsertLine(text.substr(begin, end - begin));
    begin = end + 1;
  }
  size_t handed_out = 0;
  const size_t count = tree.ProcessOP([&](std::shared_ptr<OP> op) {
    ++handed_out;
    if (op->op == orvane::fileindex::kOPNone || op->node.expired()) std::abort();
  });
  if (handed_out > count) std::abort();
  // Every accepted operation lives on exactly the node it points at.
  for (const auto& op : tree.ops) {
    auto node = op->node.lock();
    if (!node) std::abort();
    bool found = false;
    for (const auto& o : node->ops) found = found || o == op;
    if (!found) std::abort();
  }
  return 0;
}
