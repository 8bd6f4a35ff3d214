#include "fileindex/optree.hpp"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <sstream>

#include "common/error.hpp"
#include "common/log.hpp"
#include "test/test_util.hpp"

namespace orvane {
namespace fileindex {
namespace {

using ::testing::ElementsAre;
using ::testing::HasSubstr;
using ::testing::IsEmpty;

std::string Str(std::shared_ptr<OP> op) {
  std::ostringstream out;
  out << op;
  return out.str();
}

// Builds a tree from queue text written to a real file and returns what it hands out.
std::vector<std::string> Drain(const std::string& queue, size_t* count = nullptr) {
  test::TempDir dir;
  OPTree tree(dir.Write("queue", queue));
  std::vector<std::string> out;
  size_t n = tree.ProcessOP([&out](std::shared_ptr<OP> op) { out.push_back(Str(op)); });
  if (count != nullptr) *count = n;
  return out;
}

std::string Line(uint32_t bits, const std::string& path, const std::string& extra = "") {
  return "{\"event\":" + std::to_string(bits) + ",\"path\":\"" + path + "\"" + extra + "}\n";
}
std::string Create(const std::string& p) { return Line(kEventCreate, p, ",\"is_dir\":false"); }
std::string CreateDir(const std::string& p) { return Line(kEventCreate, p, ",\"is_dir\":true"); }
std::string Delete(const std::string& p) { return Line(kEventDelete, p, ",\"is_dir\":false"); }
std::string DeleteDir(const std::string& p) { return Line(kEventDelete, p, ",\"is_dir\":true"); }
std::string Modify(const std::string& p) { return Line(kEventModify, p); }
std::string CloseWrite(const std::string& p) { return Line(kEventCloseWrite, p); }
std::string Attr(const std::string& p) { return Line(kEventAttrib, p); }
std::string Reindex(const std::string& p) { return Line(kEventReindex, p); }
std::string Rename(const std::string& from, const std::string& to) {
  return Line(kEventRename, to, ",\"path_old\":\"" + from + "\"");
}
std::string Settings(const std::string& p, const std::string& data) {
  return Line(kEventFolderSettings, p, ",\"data\":" + data);
}

// Every cell of the coalescing table: a new operation from each handler meets one pending
// operation of each kind on the same node. The expectations are written out independently.
TEST(OPTreeTest, CoalescingTableCellByCell) {
  struct Outcome {
    FileIndexOP pending_after;
    bool new_kept;
  };
  const FileIndexOP kinds[] = {kOPDelete, kOPUpsert,  kOPAttr, kOPUpdateDirectory,
                               kOPRename, kOPReindex, kOPNone, kOPCrash};
  using Handler = void (OPTree::*)(std::shared_ptr<OPNode>, std::shared_ptr<OP>);
  struct Row {
    const char* name;
    Handler handler;
    FileIndexOP new_kind;
    Outcome cells[8];  // in the order of `kinds`
  };
  const Outcome keep_none = {kOPNone, true};
  const Outcome keep_crash = {kOPCrash, true};
  const Row rows[] = {
      {"create",
       &OPTree::HandleCreate,
       kOPUpsert,
       {{kOPUpsert, false},
        {kOPUpsert, false},
        {kOPUpsert, false},
        {kOPUpdateDirectory, false},
        {kOPRename, true},
        {kOPReindex, false},
        keep_none,
        keep_crash}},
      {"modify",
       &OPTree::HandleModifyAndCloseWrite,
       kOPUpsert,
       {{kOPDelete, false},
        {kOPUpsert, false},
        {kOPUpsert, false},
        {kOPUpdateDirectory, false},
        {kOPRename, true},
        {kOPReindex, false},
        keep_none,
        keep_crash}},
      {"attr",
       &OPTree::HandleAttr,
       kOPAttr,
       {{kOPDelete, false},
        {kOPUpsert, false},
        {kOPAttr, false},
        {kOPUpdateDirectory, false},
        {kOPRename, true},
        {kOPReindex, false},
        keep_none,
        keep_crash}},
      {"delete",
       &OPTree::HandleDelete,
       kOPDelete,
       {{kOPDelete, false},
        {kOPDelete, false},
        {kOPDelete, false},
        {kOPUpdateDirectory, true},
        {kOPRename, true},
        {kOPReindex, true},
        keep_none,
        keep_crash}},
      {"update directory",
       &OPTree::HandleUpdateDirectory,
       kOPUpdateDirectory,
       {{kOPDelete, false},
        {kOPUpdateDirectory, false},
        {kOPUpdateDirectory, false},
        {kOPUpdateDirectory, false},
        {kOPRename, true},
        {kOPReindex, false},
        keep_none,
        keep_crash}},
      {"reindex",
       &OPTree::HandleReindex,
       kOPReindex,
       {{kOPDelete, false},
        {kOPReindex, false},
        {kOPReindex, false},
        {kOPReindex, false},
        {kOPRename, true},
        {kOPReindex, false},
        keep_none,
        keep_crash}},
  };
  for (const Row& row : rows) {
    for (size_t k = 0; k < 8; ++k) {
      SCOPED_TRACE(std::string(row.name) + " after pending kind " + std::to_string(kinds[k]));
      OPTree tree("/dev/null");
      auto node = tree.GetNodeByPath("/v/s/f");
      auto pending = std::make_shared<OP>(node, kinds[k], "", Json::Value(Json::objectValue));
      tree.ops.push_back(pending);
      node->ops.push_back(pending);
      auto fresh = std::make_shared<OP>(node, kOPNone, "", Json::Value(Json::objectValue));
      (tree.*row.handler)(node, fresh);
      EXPECT_EQ(pending->op, row.cells[k].pending_after);
      EXPECT_EQ(fresh->op != kOPNone, row.cells[k].new_kept);
      EXPECT_EQ(tree.ops.size(), row.cells[k].new_kept ? 2u : 1u);
      if (row.cells[k].new_kept) EXPECT_EQ(fresh->op, row.new_kind);
    }
  }
}

TEST(OPTreeTest, BurstsOnOneFileCollapse) {
  EXPECT_THAT(Drain(Create("/v/s/f") + Modify("/v/s/f") + CloseWrite("/v/s/f") + Attr("/v/s/f")),
              ElementsAre("[02] /v/s/f"));
  EXPECT_THAT(Drain(Delete("/v/s/f") + Create("/v/s/f")), ElementsAre("[02] /v/s/f"));
  EXPECT_THAT(Drain(Create("/v/s/f") + Delete("/v/s/f")), ElementsAre("[01] /v/s/f"));
  EXPECT_THAT(Drain(Modify("/v/s/f") + Delete("/v/s/f")), ElementsAre("[01] /v/s/f"));
  EXPECT_THAT(Drain(Delete("/v/s/f") + Modify("/v/s/f")), ElementsAre("[01] /v/s/f"));
  EXPECT_THAT(Drain(Attr("/v/s/f")), ElementsAre("[03] /v/s/f"));
  EXPECT_THAT(Drain(Attr("/v/s/f") + Modify("/v/s/f")), ElementsAre("[02] /v/s/f"));
  // A delete does not override a pending re-index; a re-index after a delete is dropped.
  EXPECT_THAT(Drain(Reindex("/v/s/d") + DeleteDir("/v/s/d")), ElementsAre("[06] /v/s/d"));
  EXPECT_THAT(Drain(Delete("/v/s/d") + Reindex("/v/s/d")), ElementsAre("[01] /v/s/d"));
}

TEST(OPTreeTest, BitsOfOneEventShareOneOperation) {
  // Create and attribute change on one line: the upsert is turned into an attribute change
  // which then meets itself on the node and is cancelled.
  size_t count = 0;
  EXPECT_THAT(Drain(Line(kEventCreate | kEventAttrib, "/v/s/f", ",\"is_dir\":false"), &count),
              IsEmpty());
  EXPECT_EQ(count, 1u);
  // Only unknown bits: nodes, no operation.
  test::TempDir dir;
  OPTree tree(dir.Write("q", Line(0x1000, "/v/s/x")));
  EXPECT_TRUE(tree.ops.empty());
  ASSERT_EQ(tree.root->children.size(), 1u);
  EXPECT_EQ(tree.root->children[0]->children[0]->children[0]->GetPath(), "/v/s/x");
}

TEST(OPTreeTest, DirectoryReindexCancelsPendingWorkBelowButKeepsRenames) {
  EXPECT_THAT(Drain(Create("/v/s/d/a") + Modify("/v/s/d/e/b") + Rename("/v/s/x", "/v/s/d/c") +
                    CreateDir("/v/s/d") + Create("/v/s/other")),
              ElementsAre("[05] /v/s/x -> /v/s/d/c", "[06] /v/s/d", "[02] /v/s/other"));
  // A deleted directory is re-indexed as well.
  EXPECT_THAT(Drain(Create("/v/s/d/a") + DeleteDir("/v/s/d")), ElementsAre("[06] /v/s/d"));
}

TEST(OPTreeTest, RenameMovesPendingWorkAndFollowsUp) {
  // A pending upsert under the old name: handed out in its old place but under the new path,
  // then the rename, then the follow-up upsert of the new path.
  EXPECT_THAT(Drain(Create("/v/s/a") + Create("/v/s/z") + Rename("/v/s/a", "/v/s/b")),
              ElementsAre("[02] /v/s/b", "[02] /v/s/z", "[05] /v/s/a -> /v/s/b", "[02] /v/s/b"));
  // The last upsert, attribute or re-index operation of the source decides the follow-up.
  EXPECT_THAT(Drain(Attr("/v/s/a") + Rename("/v/s/a", "/v/s/b")),
              ElementsAre("[03] /v/s/b", "[05] /v/s/a -> /v/s/b", "[03] /v/s/b"));
  // Nothing pending: only the rename. Work pending on the destination is cancelled.
  EXPECT_THAT(Drain(Modify("/v/s/b") + Rename("/v/s/a", "/v/s/b")),
              ElementsAre("[05] /v/s/a -> /v/s/b"));
  // A directory's whole subtree moves; a later change lands on the new path.
  EXPECT_THAT(Drain(Create("/v/s/d/x/1") + Settings("/v/s/d/x", R"({"photo":true})") +
                    Rename("/v/s/d", "/v/s/e") + Modify("/v/s/e/x/1") + Modify("/v/s/d/x/1")),
              ElementsAre("[02] /v/s/e/x/1", "[04] /v/s/e/x, data={\"photo\":true}",
                          "[05] /v/s/d -> /v/s/e", "[02] /v/s/d/x/1"));
}

TEST(OPTreeTest, RenameIntoItsOwnSubtreeIsRejected) {
  // Impossible on a real file system; replayed, it would copy the subtree into itself again
  // and again.
  test::LogCapture log;
  std::string queue = Create("/v/a/f");
  for (int i = 0; i < 40; ++i) queue += Rename("/v", "/v/a/b");
  EXPECT_THAT(Drain(queue), ElementsAre("[02] /v/a/f"));
  EXPECT_EQ(log.Count("reason=[Rename into its own subtree: /v -> /v/a/b]"), 40);
  // Renaming onto itself is kept: like any rename it cancels the destination's pending work.
  EXPECT_THAT(Drain(Create("/v/a") + Rename("/v/a", "/v/a")), ElementsAre("[05] /v/a -> /v/a"));
}

TEST(OPTreeTest, FolderSettingsMergeByOr) {
  EXPECT_THAT(
      Drain(Settings("/v/s/d", R"({"document":true,"audio":false,"keep":1})") +
            Settings("/v/s/d", R"({"audio":true,"video":"yes","basic":false})")),
      ElementsAre(
          R"([04] /v/s/d, data={"audio":true,"basic":false,"document":true,"keep":1,"photo":false,"video":false})"));
  // Settings replace a pending upsert and carry the new data.
  EXPECT_THAT(Drain(Create("/v/s/d") + Settings("/v/s/d", R"({"photo":true})")),
              ElementsAre(R"([04] /v/s/d, data={"photo":true})"));
}

TEST(OPTreeTest, CrashedQueueYieldsOneWholeShareOperation) {
  test::LogCapture log;
  test::TempDir dir;
  const std::string queue = dir.Write(
      "q", Create("/v/s/a") + Line(kEventCrash, "/v/s") + "not even json\n" + Create("/v/s/b"));
  OPTree tree(queue);
  EXPECT_TRUE(tree.crashed);
  std::vector<std::string> out;
  EXPECT_EQ(tree.ProcessOP([&](std::shared_ptr<OP> op) {
    EXPECT_EQ(op->node.lock(), tree.root);
    out.push_back(Str(op));
  }),
            1u);
  EXPECT_THAT(out, ElementsAre("[07] "));
  // Lines after the crash were never read.
  EXPECT_EQ(log.Count("InsertEvent failed"), 0);
  EXPECT_EQ(log.Count("Queue crashed: " + queue), 1);
}

TEST(OPTreeTest, EmptyAndCancelledQueues) {
  size_t count = 9;
  EXPECT_THAT(Drain("", &count), IsEmpty());
  EXPECT_EQ(count, 0u);
  EXPECT_THAT(Drain(Line(kEventCreate | kEventAttrib, "/v/f", ",\"is_dir\":false") +
                        Line(kEventCreate | kEventModify, "/v/g", ",\"is_dir\":false"),
                    &count),
              IsEmpty());
  EXPECT_EQ(count, 2u);
  // The last line needs no newline.
  EXPECT_THAT(Drain(Create("/v/a") + "{\"event\":2,\"path\":\"/v/b\"}"),
              ElementsAre("[02] /v/a", "[02] /v/b"));
}

TEST(OPTreeTest, BadLinesAreLoggedAndSkipped) {
  test::LogCapture log;
  errno = 0;
  const std::string bad[] = {
      "",
      "not json",
      R"({"event":2})",
      R"({"path":"/v/a"})",
      R"({"event":"2","path":"/v/a"})",
      R"({"event":-1,"path":"/v/a"})",
      R"({"event":2,"path":["/v/a"]})",
      R"({"event":2,"path":"v/a"})",
      R"({"event":2,"path":"/v//a"})",
      R"({"event":2,"path":"/v/a/"})",
      R"({"event":2,"path":"/"})",
      R"({"event":256,"path":"/v/a"})",
      R"({"event":256,"path":"/v/b","path_old":"/v//a"})",
      "[1,2,3]",
      std::string("{\"event\":2,\"path\":\"/v/a\"") + '\0' + "}",
      "{\"event\":2,\"path\":\"/" + std::string(5000, 'p') + "\"}",
      std::string(kMaxEventLineLength + 10, '{'),
  };
  std::string queue;
  for (const std::string& line : bad) queue += line + "\n" + Modify("/v/ok");
  // File names are bytes: a name that is not UTF-8 is a good event.
  queue += Modify("/v/\xff\xfe");
  std::vector<std::string> out = Drain(queue);
  EXPECT_THAT(out, ElementsAre("[02] /v/ok", "[02] /v/\xff\xfe"));
  EXPECT_EQ(log.Count("InsertEvent failed"), static_cast<int>(std::size(bad)));
  // Exact text of one skipped line.
  bool found = false;
  for (const std::string& line : log.Lines()) {
    if (line.find("InsertEvent failed, event_raw=not json,") == std::string::npos) continue;
    found = true;
    EXPECT_THAT(line, ::testing::MatchesRegex(
                          "optree\\.cpp:[0-9]+ \\([0-9]+, [0-9]+\\) \\(BuildTree\\) InsertEvent "
                          "failed, event_raw=not json, code=906, reason=Orvane error, code=906, "
                          "reason=\\[Malformed event_raw: not json\\]"));
  }
  EXPECT_TRUE(found);
  EXPECT_TRUE(log.Contains("Failed [!data.fromString(event_raw)], reason: Orvane error, code=906"));
  EXPECT_TRUE(
      log.Contains("code=9999, reason=Orvane error, code=9999, reason=[GetNodeByPath "
                   "failed, path=/v//a]"));
  EXPECT_TRUE(
      log.Contains("code=120, reason=Orvane error, code=120, reason=[Missing property: "
                   "path, data={\"event\":2}]"));
}

TEST(OPTreeTest, DebugLevelLogsEveryLine) {
  test::LogCapture log;
  const int level = GetLogLevel();
  SetLogLevel(7);
  Drain(Create("/v/a"));
  SetLogLevel(level);
  EXPECT_EQ(log.Count("Got event: {\"event\":64,\"path\":\"/v/a\",\"is_dir\":false}"), 1);
}

TEST(OPTreeTest, MissingQueueIs502) {
  test::LogCapture log;
  try {
    OPTree tree("/nonexistent/queue");
    FAIL();
  } catch (const Error& e) {
    EXPECT_STREQ(e.what(),
                 "Orvane error, code=502, reason=[Failed to open queue, reason=No such file or "
                 "directory]");
  }
  EXPECT_TRUE(log.Contains("Failed [!input_stream]"));
}

TEST(OPNodeTest, ChildrenPathsAndPrinting) {
  auto root = std::make_shared<OPNode>(nullptr, "");
  EXPECT_EQ(root->GetPath(), "");
  auto v = root->GetChild("volume1");
  EXPECT_EQ(v->GetPath(), "/volume1");
  EXPECT_EQ(root->GetChild("volume1"), v);
  // Large directories are indexed: every child is still found, in creation order.
  for (int i = 0; i < 100; ++i) v->GetChild("f" + std::to_string(i));
  for (int i = 0; i < 100; ++i) EXPECT_EQ(v->GetChild("f" + std::to_string(i)), v->children[i]);
  EXPECT_EQ(v->children.size(), 100u);

  auto rename = std::make_shared<OP>(v, kOPRename, "/old", Json::Value());
  EXPECT_EQ(Str(rename), "[05] /old -> /volume1");
  auto settings = std::make_shared<OP>(v->children[3], kOPUpdateDirectory, "", Json::Value());
  settings->data["document"] = true;
  EXPECT_EQ(Str(settings), "[04] /volume1/f3, data={\"document\":true}");
  v->ops.push_back(rename);
  std::ostringstream dump;
  dump << v;
  EXPECT_THAT(dump.str(), HasSubstr("Node[/volume1]"));
  // An operation whose node is gone prints its kind (and rename source) only.
  auto orphan =
      std::make_shared<OP>(std::make_shared<OPNode>(nullptr, "x"), kOPRename, "/o", Json::Value());
  EXPECT_EQ(Str(orphan), "[05] /o -> ");
}

}  // namespace
}  // namespace fileindex
}  // namespace orvane
