// The operation tree: one share's queued file-change events folded, path by path, into the
// index operations that survive coalescing, handed out once in the order they were accepted.
// A tree is built from one queue file, processed once and dropped; it is not thread-safe.
#ifndef ORVANE_FILEINDEX_OPTREE_HPP_
#define ORVANE_FILEINDEX_OPTREE_HPP_

#include <json/json.h>

#include <cstdint>
#include <functional>
#include <memory>
#include <ostream>
#include <string>
#include <string_view>
#include <vector>

namespace orvane {
namespace fileindex {

// Event bits of a queue line.
constexpr uint32_t kEventModify = 0x2;
constexpr uint32_t kEventAttrib = 0x4;
constexpr uint32_t kEventCloseWrite = 0x8;
constexpr uint32_t kEventCreate = 0x40;
constexpr uint32_t kEventDelete = 0x80;
constexpr uint32_t kEventRename = 0x100;
constexpr uint32_t kEventCrash = 0x200;
constexpr uint32_t kEventReindex = 0x10000;
constexpr uint32_t kEventFolderSettings = 0x20000;

// The data member of a re-index line that asks only for the differences between the disk and
// the index to be applied: unchanged files are neither read nor written again.
constexpr char kReconcileKey[] = "reconcile";
// Whether a re-index line's (or operation's) data asks only for those differences.
bool IsReconcile(const Json::Value& data);

// Lines longer than this are not parsed: no real event comes near it (paths are bounded by
// PATH_MAX), and it keeps one corrupt line from costing unbounded memory.
constexpr size_t kMaxEventLineLength = 128 * 1024;

// One queue line parsed. Throws Error 906 for a line that is not JSON, Error 120 for a missing
// or mistyped "event" or "path".
class Event {
 public:
  explicit Event(const std::string& event_raw);

  uint32_t event = 0;
  bool is_dir = false;
  std::string path;
  std::string path_old;
  Json::Value data;
};

enum FileIndexOP : int32_t {
  kOPNone = 0,
  kOPDelete = 1,
  kOPUpsert = 2,
  kOPAttr = 3,
  kOPUpdateDirectory = 4,
  kOPRename = 5,
  kOPReindex = 6,
  kOPCrash = 7,
};

class OPNode;

// A pending index operation on a node. `path` is the former path of a rename; `data` the folder
// settings of a folder-settings update, or {"reconcile": true} on a re-index that only settles
// the differences.
class OP {
 public:
  OP(std::shared_ptr<OPNode> node, FileIndexOP op, const std::string& path,
     const Json::Value& data);

  // ORs the content switches of newer folder settings into `data`.
  void MergeData(const Json::Value& data);

  std::weak_ptr<OPNode> node;
  FileIndexOP op;
  std::string path;
  Json::Value data;
};

std::ostream& operator<<(std::ostream& out, std::shared_ptr<OP> op);

// One path component. Children are owned by their parent and kept in creation order; they must
// be added through GetChild(), which also keeps the name index of large directories.
class OPNode : public std::enable_shared_from_this<OPNode> {
 public:
  OPNode(std::shared_ptr<OPNode> parent, const std::string& name);
  OPNode(const OPNode&) = delete;
  OPNode& operator=(const OPNode&) = delete;

  // "/a/b" for the node b under a under the root; "" for the root.
  std::string GetPath() const;
  // The child of that name, created when missing.
  std::shared_ptr<OPNode> GetChild(std::string_view name);
  // Calls `fn` on a copy of `ops`, so `fn` may move or cancel operations.
  void TraverseOP(std::function<void(std::shared_ptr<OP>)> fn);

  const std::string name;
  std::weak_ptr<OPNode> parent;
  std::vector<std::shared_ptr<OPNode>> children;
  std::vector<std::shared_ptr<OP>> ops;

 private:
  void IndexChild(uint32_t position);

  // Hashes of the children's names, by position: a scan compares these and touches a child
  // only on a match, which keeps a walk down a large tree from missing the cache at every node.
  std::vector<uint32_t> child_hashes_;
  // Open-addressed index of `children` (position + 1, 0 = empty), built once a directory has
  // more children than a linear scan handles well.
  std::vector<uint32_t> child_slots_;
};

std::ostream& operator<<(std::ostream& out, std::shared_ptr<OPNode> node);

class OPTree {
 public:
  // Reads the queue file at `path` into the tree; throws Error 502 when it cannot be opened.
  explicit OPTree(const std::string& path);
  ~OPTree();
  OPTree(const OPTree&) = delete;
  OPTree& operator=(const OPTree&) = delete;

  void BuildTree();
  // Hands every surviving operation to `callback` in acceptance order and returns the number of
  // accepted operations (cancelled ones included); a crashed queue yields one kOPCrash on the
  // root and returns 1.
  size_t ProcessOP(std::function<void(std::shared_ptr<OP>)> callback);

  // Parses one raw queue line and inserts it; a bad line is logged and skipped.
  void InsertLine(const std::string& line);
  void InsertEvent(std::shared_ptr<Event> event);
  // The node of an absolute path (created as needed); Error 9999 for a path that is not
  // "/"-separated without doubled or trailing "/", or longer than PATH_MAX.
  std::shared_ptr<OPNode> GetNodeByPath(const std::string& path);

  void HandleCreate(std::shared_ptr<OPNode> node, std::shared_ptr<OP> op);
  void HandleDelete(std::shared_ptr<OPNode> node, std::shared_ptr<OP> op);
  void HandleAttr(std::shared_ptr<OPNode> node, std::shared_ptr<OP> op);
  void HandleModifyAndCloseWrite(std::shared_ptr<OPNode> node, std::shared_ptr<OP> op);
  void HandleUpdateDirectory(std::shared_ptr<OPNode> node, std::shared_ptr<OP> op);
  void HandleReindex(std::shared_ptr<OPNode> node, std::shared_ptr<OP> op);
  void HandleRename(std::shared_ptr<OPNode> node, std::shared_ptr<OP> op);

  // Post-order walk of the subtree of `node` over copies of each `children` vector.
  void TraverseNodeDescendant(std::shared_ptr<OPNode> node,
                              std::function<void(std::shared_ptr<OPNode>)> fn, bool skip_self);

  bool crashed;
  std::string path;
  std::shared_ptr<OPNode> root;
  std::vector<std::shared_ptr<OP>> ops;

 private:
  void Accept(const std::shared_ptr<OPNode>& node, const std::shared_ptr<OP>& op);
  void LogInsertFailure(const std::string& line, int code, const char* reason);

  // The last path resolved and its node: bursts of events on one file resolve it once.
  std::string last_path_;
  std::shared_ptr<OPNode> last_node_;
};

}  // namespace fileindex
}  // namespace orvane

#endif  // ORVANE_FILEINDEX_OPTREE_HPP_
