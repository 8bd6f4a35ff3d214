#include "fileindex/optree.hpp"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <sstream>

#include "test/test_util.hpp"

namespace orvane {
namespace fileindex {
namespace {

using ::testing::ElementsAre;
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
std::string Delete(const std::string& p) { return Line(kEventDelete, p, ",\"is_dir\":false"); }
std::string DeleteDir(const std::string& p) { return Line(kEventDelete, p, ",\"is_dir\":true"); }
std::string Modify(const std::string& p) { return Line(kEventModify, p); }
std::string Attr(const std::string& p) { return Line(kEventAttrib, p); }
std::string Rename(const std::string& from, const std::string& to) {
  return Line(kEventRename, to, ",\"path_old\":\"" + from + "\"");
}
std::string Settings(const std::string& p, const std::string& data) {
  return Line(kEventFolderSettings, p, ",\"data\":" + data);
}

// Every cell of the coalescing table: a new operation from each handler meets one pending
// operation of each kind on the same node. A cell reads "<pending kind after><+ if the new one
// is kept, - if cancelled>"; the columns are the pending kinds none, delete, upsert, attr,
// update directory, rename, reindex, crash. The expectations are written out independently.
TEST(OPTreeTest, CoalescingTableCellByCell) {
  using Handler = void (OPTree::*)(std::shared_ptr<OPNode>, std::shared_ptr<OP>);
  const struct {
    Handler handler;
    FileIndexOP new_kind;
    const char* cells;
  } rows[] = {
      {&OPTree::HandleCreate, kOPUpsert, "0+ 2- 2- 2- 4- 5+ 6- 7+"},
      {&OPTree::HandleModifyAndCloseWrite, kOPUpsert, "0+ 1- 2- 2- 4- 5+ 6- 7+"},
      {&OPTree::HandleAttr, kOPAttr, "0+ 1- 2- 3- 4- 5+ 6- 7+"},
      {&OPTree::HandleDelete, kOPDelete, "0+ 1- 1- 1- 4+ 5+ 6+ 7+"},
      {&OPTree::HandleUpdateDirectory, kOPUpdateDirectory, "0+ 1- 4- 4- 4- 5+ 6- 7+"},
      {&OPTree::HandleReindex, kOPReindex, "0+ 6- 6- 6- 6- 5+ 6- 7+"},
  };
  for (const auto& row : rows) {
    for (int k = 0; k < 8; ++k) {
      SCOPED_TRACE("new kind " + std::to_string(row.new_kind) + ", pending kind " +
                   std::to_string(k));
      const int after = row.cells[3 * k] - '0';
      const bool kept = row.cells[3 * k + 1] == '+';
      OPTree tree("/dev/null");
      auto node = tree.GetNodeByPath("/v/s/f");
      auto pending = std::make_shared<OP>(node, static_cast<FileIndexOP>(k), "",
                                          Json::Value(Json::objectValue));
      tree.ops.push_back(pending);
      node->ops.push_back(pending);
      auto fresh = std::make_shared<OP>(node, kOPNone, "", Json::Value(Json::objectValue));
      (tree.*row.handler)(node, fresh);
      EXPECT_EQ(pending->op, after);
      EXPECT_EQ(fresh->op, kept ? row.new_kind : kOPNone);
      EXPECT_EQ(tree.ops.size(), kept ? 2u : 1u);
    }
  }
}

TEST(OPTreeTest, EventBitsReachTheirHandlers) {
  EXPECT_THAT(Drain(Create("/v/s/f") + Modify("/v/s/f") + Line(kEventCloseWrite, "/v/s/f") +
                    Attr("/v/s/f")),
              ElementsAre("[02] /v/s/f"));
  EXPECT_THAT(Drain(Attr("/v/s/f")), ElementsAre("[03] /v/s/f"));
  // Create and attribute change on one line share one operation: the upsert is turned into an
  // attribute change which then meets itself on the node and is cancelled.
  size_t count = 9;
  EXPECT_THAT(Drain(Line(kEventCreate | kEventAttrib, "/v/f", ",\"is_dir\":false") +
                        Line(kEventCreate | kEventModify, "/v/g", ",\"is_dir\":false"),
                    &count),
              IsEmpty());
  EXPECT_EQ(count, 2u);
  // Unknown bits make nodes but no operation; the last line needs no newline.
  EXPECT_THAT(Drain(Line(0x1000, "/v/s/x") + "{\"event\":2,\"path\":\"/v/b\"}"),
              ElementsAre("[02] /v/b"));
}

TEST(OPTreeTest, DirectoryReindexCancelsPendingWorkBelowButKeepsRenames) {
  EXPECT_THAT(Drain(Create("/v/s/d/a") + Modify("/v/s/d/e/b") + Rename("/v/s/x", "/v/s/d/c") +
                    Line(kEventCreate, "/v/s/d", ",\"is_dir\":true") + Create("/v/s/other")),
              ElementsAre("[05] /v/s/x -> /v/s/d/c", "[06] /v/s/d", "[02] /v/s/other"));
  // A deleted directory is re-indexed as well, once.
  EXPECT_THAT(Drain(Create("/v/s/d/a") + DeleteDir("/v/s/d") + DeleteDir("/v/s/d")),
              ElementsAre("[06] /v/s/d"));
}

// A name turned from file to folder and back, as fast as the watcher can report it: whatever
// the name is at the end, the last word on it must be a crawl or an upsert, never a delete,
// and there is one of it.
TEST(OPTreeTest, NameToggledBetweenFileAndFolderEndsIndexed) {
  std::string queue;
  for (int toggles = 1; toggles <= 20; ++toggles) {
    const bool now_dir = toggles % 2 == 1;
    queue += now_dir ? Delete("/v/s/t") + Line(kEventCreate, "/v/s/t", ",\"is_dir\":true")
                     : DeleteDir("/v/s/t") + Create("/v/s/t");
    SCOPED_TRACE(std::to_string(toggles) + " toggles");
    const std::vector<std::string> ops = Drain(queue);
    ASSERT_FALSE(ops.empty());
    EXPECT_THAT(ops.back(), ::testing::AnyOf("[06] /v/s/t", "[02] /v/s/t"));
    EXPECT_THAT(ops, ::testing::Not(::testing::Contains("[01] /v/s/t")));
  }
  // From a folder that was being crawled: removed, made a file, removed, made a folder.
  EXPECT_THAT(
      Drain(Line(kEventCreate, "/v/s/t", ",\"is_dir\":true") + DeleteDir("/v/s/t") +
            Create("/v/s/t") + Delete("/v/s/t") + Line(kEventCreate, "/v/s/t", ",\"is_dir\":true")),
      ::testing::Each("[06] /v/s/t"));
}

TEST(OPTreeTest, ReconciliationsFoldIntoEachOtherAndGiveWayToFullReindexes) {
  const std::string reconcile = ",\"is_dir\":true,\"data\":{\"reconcile\":true}";
  auto check = [&](const std::string& p) { return Line(kEventReindex, p, reconcile); };
  auto reindex = [](const std::string& p) { return Line(kEventReindex, p, ",\"is_dir\":true"); };
  // Two reconciliations of one folder are one; one below another is covered by it, but the
  // work queued below stays, whether a change or a full re-index.
  EXPECT_THAT(Drain(Create("/v/s/d/a") + check("/v/s/d/e") + reindex("/v/s/d/f") + check("/v/s/d") +
                    check("/v/s/d")),
              ElementsAre("[02] /v/s/d/a", "[06] /v/s/d/f", "[06] /v/s/d, reconcile"));
  // A full re-index of the same folder wins in either order, and cancels what lies below.
  EXPECT_THAT(Drain(check("/v/s/d") + Create("/v/s/d/a") + reindex("/v/s/d")),
              ElementsAre("[06] /v/s/d"));
  EXPECT_THAT(Drain(reindex("/v/s/d") + check("/v/s/d")), ElementsAre("[06] /v/s/d"));
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
}

// Members missing or of the wrong type are refused by the JSON helpers' own rules.
TEST(OPTreeTest, BadLinesAreLoggedAndSkipped) {
  test::LogCapture log;
  errno = 0;
  const std::string bad[] = {
      "",
      "not json",
      R"({"event":2})",
      R"({"event":-1,"path":"/v/a"})",
      R"({"event":2,"path":"v/a"})",
      R"({"event":2,"path":"/v//a"})",
      R"({"event":2,"path":"/v/a/"})",
      R"({"event":2,"path":"/"})",
      R"({"event":256,"path":"/v/a"})",
      R"({"event":256,"path":"/v/b","path_old":"/v//a"})",
      std::string("{\"event\":2,\"path\":\"/v/a\"") + '\0' + "}",
      "{\"event\":2,\"path\":\"/" + std::string(5000, 'p') + "\"}",
      std::string(kMaxEventLineLength + 10, '{'),
  };
  std::string queue;
  for (const std::string& line : bad) queue += line + "\n" + Modify("/v/ok");
  // File names are bytes: a name that is not UTF-8 is a good event.
  queue += Modify("/v/\xff\xfe");
  EXPECT_THAT(Drain(queue), ElementsAre("[02] /v/ok", "[02] /v/\xff\xfe"));
  EXPECT_EQ(log.Count("InsertEvent failed"), static_cast<int>(std::size(bad)));
  EXPECT_EQ(log.Count("event_raw=" + std::string(256, '{') +
                      "..., code=906, reason=Orvane "
                      "error, code=906, reason=[Event line too long: over 131072 bytes]"),
            1);
  // Exact text of one skipped line.
  EXPECT_THAT(log.Lines(),
              ::testing::Contains(::testing::MatchesRegex(
                  "optree\\.cpp:[0-9]+ \\([0-9]+, [0-9]+\\) \\(BuildTree\\) InsertEvent "
                  "failed, event_raw=not json, code=906, reason=Orvane error, "
                  "code=906, reason=\\[Malformed event_raw: not json\\]")));
}

TEST(OPNodeTest, LargeDirectoriesFindEveryChild) {
  auto root = std::make_shared<OPNode>(nullptr, "");
  auto v = root->GetChild("volume1");
  // Large directories are indexed: every child is still found, in creation order.
  for (int i = 0; i < 100; ++i) v->GetChild("f" + std::to_string(i));
  for (int i = 0; i < 100; ++i) EXPECT_EQ(v->GetChild("f" + std::to_string(i)), v->children[i]);
  EXPECT_EQ(v->children.size(), 100u);
}

}  // namespace
}  // namespace fileindex
}  // namespace orvane
