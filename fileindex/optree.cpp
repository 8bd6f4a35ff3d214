#include "fileindex/optree.hpp"

#include <syslog.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <climits>
#include <cstring>

#include "common/error.hpp"
#include "common/json_util.hpp"
#include "common/log.hpp"
#include "common/util.hpp"
#include "fileindex/queue_file.hpp"

namespace orvane {
namespace fileindex {

Event::Event(const std::string& event_raw) {
  JsonValue data;
  ORVANE_THROW_IF(!data.fromString(event_raw), kErrMalformedEvent,
                  "Malformed event_raw: " + event_raw);
  GetJsonValue<unsigned int>(event, data, "event", true);
  GetJsonValue<bool>(is_dir, data, "is_dir", false);
  GetJsonValue<std::string>(path, data, "path", true);
  GetJsonValue<std::string>(path_old, data, "path_old", false);
  GetJsonValue<Json::Value>(this->data, data, "data", false);
}

bool IsReconcile(const Json::Value& data) {
  if (!data.isObject()) return false;
  const Json::Value* flag = data.find(kReconcileKey, kReconcileKey + strlen(kReconcileKey));
  return flag != nullptr && flag->isBool() && flag->asBool();
}

OP::OP(std::shared_ptr<OPNode> node, FileIndexOP op, const std::string& path,
       const Json::Value& data)
    : node(node), op(op), path(path), data(data) {}

void OP::MergeData(const Json::Value& newer) {
  static const char* const kSwitches[] = {"document", "audio", "video", "photo", "basic"};
  // Settings that are not an object carry no switches; the stored ones become an object so the
  // merged switches have somewhere to live.
  if (!data.isObject()) data = Json::Value(Json::objectValue);
  for (const char* key : kSwitches) {
    const Json::Value* incoming = newer.isObject() ? newer.find(key, key + strlen(key)) : nullptr;
    const Json::Value* stored = data.find(key, key + strlen(key));
    const bool on = (incoming != nullptr && incoming->isBool() && incoming->asBool()) ||
                    (stored != nullptr && stored->isBool() && stored->asBool());
    data[key] = on;
  }
}

std::ostream& operator<<(std::ostream& out, std::shared_ptr<OP> op) {
  char kind[8];
  std::snprintf(kind, sizeof(kind), "[%02d] ", static_cast<int>(op->op));
  out << kind;
  if (op->op == kOPRename) out << op->path << " -> ";
  if (auto node = op->node.lock()) out << node->GetPath();
  if (op->op == kOPUpdateDirectory) out << ", data=" << JsonToString(op->data);
  if (op->op == kOPReindex && IsReconcile(op->data)) out << ", reconcile";
  return out;
}

namespace {

// Directories up to this size are searched linearly; larger ones get a hashed index.
constexpr size_t kLinearChildren = 8;

uint32_t HashName(std::string_view name) {
  return static_cast<uint32_t>(std::hash<std::string_view>()(name));
}

}  // namespace

OPNode::OPNode(std::shared_ptr<OPNode> parent, const std::string& name)
    : name(name), parent(parent) {}

std::string OPNode::GetPath() const {
  std::vector<const OPNode*> chain;
  size_t size = 0;
  std::shared_ptr<const OPNode> up;
  for (const OPNode* n = this; n != nullptr;) {
    chain.push_back(n);
    size += n->name.size() + 1;
    up = n->parent.lock();
    n = up.get();
  }
  // The root contributes no component.
  chain.pop_back();
  std::string path;
  path.reserve(size);
  for (auto it = chain.rbegin(); it != chain.rend(); ++it) {
    path += '/';
    path += (*it)->name;
  }
  return path;
}

std::shared_ptr<OPNode> OPNode::GetChild(std::string_view name) {
  const uint32_t hash = HashName(name);
  if (child_slots_.empty()) {
    for (size_t i = 0; i < children.size(); ++i) {
      if (child_hashes_[i] == hash && children[i]->name == name) return children[i];
    }
  } else {
    const size_t mask = child_slots_.size() - 1;
    for (size_t i = hash & mask; child_slots_[i] != 0; i = (i + 1) & mask) {
      const uint32_t position = child_slots_[i] - 1;
      if (child_hashes_[position] == hash && children[position]->name == name) {
        return children[position];
      }
    }
  }
  children.push_back(std::make_shared<OPNode>(shared_from_this(), std::string(name)));
  child_hashes_.push_back(hash);
  if (children.size() > kLinearChildren) IndexChild(static_cast<uint32_t>(children.size() - 1));
  return children.back();
}

void OPNode::IndexChild(uint32_t position) {
  // Kept at most half full so probes stay short; rebuilt whole when it grows.
  if (child_slots_.size() < 2 * children.size()) {
    size_t size = 16;
    while (size < 4 * children.size()) size *= 2;
    child_slots_.assign(size, 0);
    for (uint32_t i = 0; i < children.size(); ++i) {
      if (i != position) IndexChild(i);
    }
  }
  const size_t mask = child_slots_.size() - 1;
  size_t i = child_hashes_[position] & mask;
  while (child_slots_[i] != 0) i = (i + 1) & mask;
  child_slots_[i] = position + 1;
}

void OPNode::TraverseOP(std::function<void(std::shared_ptr<OP>)> fn) {
  const std::vector<std::shared_ptr<OP>> copy = ops;
  for (const auto& op : copy) fn(op);
}

std::ostream& operator<<(std::ostream& out, std::shared_ptr<OPNode> node) {
  out << "Node[" << node->GetPath() << "] {";
  for (size_t i = 0; i < node->ops.size(); ++i) out << (i == 0 ? "" : ", ") << node->ops[i];
  return out << "}";
}

namespace {

// What a new operation does to an operation already pending on its node.
enum Action : uint8_t {
  kKeep,         // nothing changes
  kDrop,         // the new operation is cancelled
  kToUpsert,     // the pending one becomes an upsert and the new one is cancelled
  kToDelete,     // ... becomes a delete
  kToReindex,    // ... becomes a re-index
  kToUpdateDir,  // ... becomes a folder-settings update carrying the new settings
  kMerge,        // the pending settings absorb the new switches; the new one is cancelled
};

// One row per handler, indexed by the pending operation's kind (kOPNone to kOPCrash).
// A create after a pending delete revives it as an upsert while a modification after it is
// dropped; a delete never overrides a pending re-index or folder-settings update. A re-index
// after a pending delete takes the delete's place: the name came back as a folder (or a folder
// went away where a file was), and the crawl both removes what is gone and indexes what is there.
using Rules = std::array<Action, 8>;
// clang-format off
//                 pending:   none   delete     upsert        attr          update dir    rename reindex crash
constexpr Rules kCreateRules   = {kKeep, kToUpsert, kDrop,        kToUpsert,    kDrop,        kKeep, kDrop,  kKeep};
constexpr Rules kModifyRules   = {kKeep, kDrop,     kDrop,        kToUpsert,    kDrop,        kKeep, kDrop,  kKeep};
constexpr Rules kAttrRules     = {kKeep, kDrop,     kDrop,        kDrop,        kDrop,        kKeep, kDrop,  kKeep};
constexpr Rules kDeleteRules   = {kKeep, kDrop,     kToDelete,    kToDelete,    kKeep,        kKeep, kKeep,  kKeep};
constexpr Rules kUpdateDirRules= {kKeep, kDrop,     kToUpdateDir, kToUpdateDir, kMerge,       kKeep, kDrop,  kKeep};
constexpr Rules kReindexRules  = {kKeep, kToReindex, kToReindex,  kToReindex,   kToReindex,   kKeep, kDrop,  kKeep};
// clang-format on

// Gives `op` its kind, then applies `rules` against every operation pending on the node,
// cancelled ones included, even once `op` itself has been cancelled. True when `op` is kept.
bool Coalesce(OPNode& node, OP& op, FileIndexOP kind, const Rules& rules) {
  op.op = kind;
  node.TraverseOP([&](std::shared_ptr<OP> pending) {
    switch (rules[pending->op]) {
      case kKeep:
        return;
      case kDrop:
        break;
      case kToUpsert:
        pending->op = kOPUpsert;
        break;
      case kToDelete:
        pending->op = kOPDelete;
        break;
      case kToReindex:
        pending->op = kOPReindex;
        break;
      case kToUpdateDir:
        pending->op = kOPUpdateDirectory;
        pending->data = op.data;
        break;
      case kMerge:
        pending->MergeData(op.data);
        break;
    }
    op.op = kOPNone;
  });
  return op.op != kOPNone;
}

}  // namespace

OPTree::OPTree(const std::string& path)
    : crashed(false), path(path), root(std::make_shared<OPNode>(nullptr, "")) {
  BuildTree();
}

OPTree::~OPTree() = default;

void OPTree::BuildTree() {
  QueueFileReader input_stream(path);
  ORVANE_THROW_IF(!input_stream, kErrSystem,
                  std::string("Failed to open queue, reason=") + std::strerror(errno));
  std::string line;
  while (!crashed && input_stream.ReadLine(&line, kMaxEventLineLength)) InsertLine(line);
}

void OPTree::InsertLine(const std::string& line) {
  if (GetLogLevel() == LOG_DEBUG) {
    ORVANE_LOG(LOG_ERR, "Got event: %s", line.c_str());
  }
  if (line.size() > kMaxEventLineLength) {
    // The reader keeps one byte past the limit, so the line's real length is not known here.
    const Error error(kErrMalformedEvent, "Event line too long: over " +
                                              std::to_string(kMaxEventLineLength) + " bytes");
    LogInsertFailure(line.substr(0, 256) + "...", error.code, error.what());
    return;
  }
  try {
    InsertEvent(std::make_shared<Event>(line));
  } catch (const Error& e) {
    LogInsertFailure(line, e.code, e.what());
  }
}

void OPTree::LogInsertFailure(const std::string& line, int code, const char* reason) {
  // Named after the reading loop: that is where an administrator looks for skipped lines.
  ORVANE_LOG_FAILED_IN("BuildTree", "InsertEvent failed, event_raw=%s, code=%d, reason=%s",
                       line.c_str(), code, reason);
}

size_t OPTree::ProcessOP(std::function<void(std::shared_ptr<OP>)> callback) {
  if (crashed) {
    ORVANE_LOG(LOG_ERR, "Queue crashed: %s", path.c_str());
    callback(std::make_shared<OP>(root, kOPCrash, "", Json::Value()));
    return 1;
  }
  for (size_t i = 0; i < ops.size(); ++i) {
    if (ops[i]->op != kOPNone) callback(ops[i]);
  }
  return ops.size();
}

std::shared_ptr<OPNode> OPTree::GetNodeByPath(const std::string& path) {
  if (last_node_ && path == last_path_) return last_node_;
  ORVANE_THROW_IF(path.size() > PATH_MAX, kErrOPTreePath, "GetNodeByPath failed, path=" + path);
  std::shared_ptr<OPNode> node = root;
  for (size_t begin = 0; begin < path.size();) {
    size_t end = path.find('/', begin);
    if (end == std::string::npos) end = path.size();
    if (end > begin) node = node->GetChild(std::string_view(path).substr(begin, end - begin));
    begin = end + 1;
  }
  // The reached node spells `path` back exactly when the path is "" or "/"-led with no empty
  // component; checking that is the same test as comparing with GetPath(), without building it.
  const bool spelled_back = path.empty() || (path[0] == '/' && path.back() != '/' &&
                                             path.find("//") == std::string::npos);
  ORVANE_THROW_IF(!spelled_back, kErrOPTreePath, "GetNodeByPath failed, path=" + path);
  last_path_ = path;
  last_node_ = node;
  return node;
}

void OPTree::InsertEvent(std::shared_ptr<Event> event) {
  const uint32_t bits = event->event;
  if (bits & kEventRename) {
    // An empty former path would name the root and move every pending operation of the share;
    // a folder cannot be moved into itself, and replaying such a line would copy the subtree
    // into itself on every repetition.
    if (event->path_old.empty()) throw Error(kErrInvalidParam, "Missing property: path_old");
    if (StringStartWith(event->path, event->path_old + "/")) {
      throw Error(kErrInvalidParam,
                  "Rename into its own subtree: " + event->path_old + " -> " + event->path);
    }
  }
  std::shared_ptr<OPNode> node = GetNodeByPath(event->path);
  auto op = std::make_shared<OP>(node, kOPNone, "", Json::Value());
  // One operation is shared by every handler the bits select, each overwriting its kind.
  if (bits & kEventCreate) event->is_dir ? HandleReindex(node, op) : HandleCreate(node, op);
  if (bits & kEventAttrib) HandleAttr(node, op);
  if (bits & (kEventModify | kEventCloseWrite)) HandleModifyAndCloseWrite(node, op);
  if (bits & kEventDelete) event->is_dir ? HandleReindex(node, op) : HandleDelete(node, op);
  if (bits & kEventRename) {
    op->path = event->path_old;
    HandleRename(node, op);
  }
  if (bits & kEventReindex) {
    // Only a line that is nothing but a re-index may ask for the cheap form of it.
    if (bits == kEventReindex && IsReconcile(event->data)) op->data = event->data;
    HandleReindex(node, op);
  }
  if (bits & kEventFolderSettings) {
    op->data = event->data;
    HandleUpdateDirectory(node, op);
  }
  if (bits & kEventCrash) crashed = true;
}

void OPTree::Accept(const std::shared_ptr<OPNode>& node, const std::shared_ptr<OP>& op) {
  ops.push_back(op);
  node->ops.push_back(op);
}

void OPTree::HandleCreate(std::shared_ptr<OPNode> node, std::shared_ptr<OP> op) {
  if (Coalesce(*node, *op, kOPUpsert, kCreateRules)) Accept(node, op);
}

void OPTree::HandleDelete(std::shared_ptr<OPNode> node, std::shared_ptr<OP> op) {
  if (Coalesce(*node, *op, kOPDelete, kDeleteRules)) Accept(node, op);
}

void OPTree::HandleAttr(std::shared_ptr<OPNode> node, std::shared_ptr<OP> op) {
  if (Coalesce(*node, *op, kOPAttr, kAttrRules)) Accept(node, op);
}

void OPTree::HandleModifyAndCloseWrite(std::shared_ptr<OPNode> node, std::shared_ptr<OP> op) {
  if (Coalesce(*node, *op, kOPUpsert, kModifyRules)) Accept(node, op);
}

void OPTree::HandleUpdateDirectory(std::shared_ptr<OPNode> node, std::shared_ptr<OP> op) {
  if (Coalesce(*node, *op, kOPUpdateDirectory, kUpdateDirRules)) Accept(node, op);
}

void OPTree::HandleReindex(std::shared_ptr<OPNode> node, std::shared_ptr<OP> op) {
  const bool reconcile = IsReconcile(op->data);
  if (!reconcile) {
    // A full re-index absorbs a reconciliation pending on the same folder: what is kept must
    // read everything again.
    for (const auto& pending : node->ops) {
      if (pending->op == kOPReindex) pending->data = Json::Value();
    }
  }
  Coalesce(*node, *op, kOPReindex, kReindexRules);
  // A full re-index covers everything below, whether or not it was itself kept. A
  // reconciliation only covers the reconciliations below: the work queued there may be a full
  // re-index or a change its comparison of sizes and times would not see.
  TraverseNodeDescendant(
      node,
      [reconcile](std::shared_ptr<OPNode> descendant) {
        for (const auto& pending : descendant->ops) {
          if (pending->op == kOPRename) continue;
          if (!reconcile || (pending->op == kOPReindex && IsReconcile(pending->data))) {
            pending->op = kOPNone;
          }
        }
      },
      true);
  if (op->op != kOPNone) Accept(node, op);
}

namespace {

// Moves `op` to the end of `to`'s operations; it keeps its place in the tree's list.
void MoveOP(const std::shared_ptr<OP>& op, const std::shared_ptr<OPNode>& from,
            const std::shared_ptr<OPNode>& to) {
  to->ops.push_back(op);
  auto it = std::find(from->ops.begin(), from->ops.end(), op);
  if (it != from->ops.end()) from->ops.erase(it);
  op->node = to;
}

}  // namespace

void OPTree::HandleRename(std::shared_ptr<OPNode> node, std::shared_ptr<OP> op) {
  std::shared_ptr<OPNode> source = GetNodeByPath(op->path);
  const std::string new_path = node->GetPath();
  const std::string& old_path = op->path;
  auto follow_up = std::make_shared<OP>(node, kOPNone, "", Json::Value());
  op->op = kOPRename;
  for (const auto& pending : node->ops) {
    if (pending->op == kOPDelete || pending->op == kOPUpsert || pending->op == kOPAttr) {
      pending->op = kOPNone;
    }
  }
  // Content or attribute work pending under the old name is redone under the new one.
  source->TraverseOP([&](std::shared_ptr<OP> pending) {
    if (pending->op == kOPUpsert || pending->op == kOPAttr || pending->op == kOPReindex) {
      follow_up->op = pending->op;
    }
    MoveOP(pending, source, node);
  });
  TraverseNodeDescendant(
      source,
      [&](std::shared_ptr<OPNode> descendant) {
        const std::string moved = new_path + descendant->GetPath().substr(old_path.size());
        std::shared_ptr<OPNode> target = GetNodeByPath(moved);
        descendant->TraverseOP(
            [&](std::shared_ptr<OP> pending) { MoveOP(pending, descendant, target); });
      },
      true);
  Accept(node, op);
  if (follow_up->op != kOPNone) Accept(node, follow_up);
}

void OPTree::TraverseNodeDescendant(std::shared_ptr<OPNode> node,
                                    std::function<void(std::shared_ptr<OPNode>)> fn,
                                    bool skip_self) {
  const std::vector<std::shared_ptr<OPNode>> children = node->children;
  for (const auto& child : children) TraverseNodeDescendant(child, fn, false);
  if (!skip_self) fn(node);
}

}  // namespace fileindex
}  // namespace orvane
