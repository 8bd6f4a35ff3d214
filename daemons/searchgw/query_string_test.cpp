#include <gtest/gtest.h>

#include <string>

#include "common/json_util.hpp"
#include "daemons/searchgw/query_string.hpp"
#include "daemons/searchgw/search_request.hpp"
#include "test/test_util.hpp"

namespace orvane {
namespace searchgw {
namespace {

std::string Tree(const std::string& query) {
  return JsonToString(TranslateQuery(ParseQueryString(query)));
}

TEST(QueryStringTest, QueriesBecomeEngineTrees) {
  struct Row {
    const char* query;
    const char* tree;
  };
  const Row rows[] = {
      // What the older clients send: a name pattern within a folder.
      {"(name:*foo*) AND path.real.fulltext:\"/srv/share/sub\"",
       R"({"and":[{"match":"name","pattern":"*foo*"},{"under":"/srv/share/sub"}]})"},
      {"report", R"({"match":"any","pattern":"report"})"},
      {"content:(alpha beta)",
       R"({"or":[{"match":"content","pattern":"alpha"},{"match":"content","pattern":"beta"}]})"},
      // AND binds tighter than OR, NOT tighter than AND.
      {"a OR b AND NOT c",
       R"({"or":[{"match":"any","pattern":"a"},{"and":[{"match":"any","pattern":"b"},)"
       R"({"not":{"match":"any","pattern":"c"}}]}]})"},
      {"NOT (name:x OR name:y)",
       R"({"not":{"or":[{"match":"name","pattern":"x"},{"match":"name","pattern":"y"}]}})"},
      // Escapes: a space, a colon and a parenthesis in a term; operators only when bare.
      {"name:my\\ file\\:\\(1\\)", R"x({"match":"name","pattern":"my file:(1)"})x"},
      {"name:\\AND", R"({"match":"name","pattern":"AND"})"},
      {"size:[1024 TO 4096}", R"({"gte":1024,"lt":4096,"range":"size"})"},
      {"size:{100 TO *]", R"({"gt":100,"range":"size"})"},
      {"size:[* TO *]", R"({"all":true})"},
      {"size:512", R"({"gte":512,"lte":512,"range":"size"})"},
      {"mtime:[2024-01-01T00:00:00Z TO 2024-01-02]",
       R"({"gte":1704067200,"lte":1704153600,"range":"mtime"})"},
      {"crtime:{* TO 2024-01-01T00:00:00.250+00:00}", R"({"lt":1704067200,"range":"crtime"})"},
      {"type:kind.photo OR type:ext.pdf",
       R"({"or":[{"in":"kind","values":["photo"]},{"in":"ext","values":["pdf"]}]})"},
      {"type:(kind.audio ext.flac\\ ext.ogg)",
       R"({"or":[{"in":"kind","values":["audio"]},{"or":[{"in":"ext","values":["flac"]},)"
       R"({"in":"ext","values":["ogg"]}]}]})"},
      {"NOT mtime:2024-01-01T00\\:00:00Z",
       R"({"not":{"gte":1704067200,"lte":1704067200,"range":"mtime"}})"},
      {"path.real:/srv/share/", R"({"under":"/srv/share"})"},
      {"path.real:\\/srv\\/x\\/*", R"({"under":"/srv/x"})"},
      // Members of the document: their own fields, numbers ranged, texts matched.
      {"duration:{60 TO *}", R"({"gt":60,"range":"duration"})"},
      {"title:\"annual report\"", R"({"match":"title","pattern":"annual report"})"},
      {"path:\\/srv\\/s\\/*.pdf", R"({"match":"path","pattern":"/srv/s/*.pdf"})"},
  };
  for (const Row& r : rows) EXPECT_EQ(Tree(r.query), r.tree) << r.query;
}

TEST(QueryStringTest, MalformedQueriesAndUnknownFieldsAreRefusedWithAReason) {
  struct Row {
    const char* query;
    const char* says;
  };
  const Row syntax[] = {
      {"", "expected a term"},
      {"(name:a", "expected \")\""},
      {"name:a)", "found \")\" at position 6"},
      {"a AND", "found the end of the query"},
      {"name:\"open", "never closed"},
      {"name:", "a value after \"name:\""},
      {"size:[1 2]", "expected \"TO\""},
      {"size:[1 TO 2", "\"]\" or \"}\""},
      {"[1 TO 2]", "a field before the range"},
      {"name:(content:x)", "a field inside"},
      {"trailing\\", "lone backslash"},
  };
  for (const Row& r : syntax) {
    try {
      ParseQueryString(r.query);
      ADD_FAILURE() << r.query << " parsed";
    } catch (const QuerySyntaxError& e) {
      EXPECT_NE(std::string(e.what()).find(r.says), std::string::npos)
          << r.query << ": " << e.what();
    }
  }
  const Row meaning[] = {
      {"meta.raw.Image\\ Height:10", "unknown field \"meta.raw.Image Height\""},
      {"size:big", "\"big\" is not a number for size"},
      {"mtime:[yesterday TO *]", "ISO-8601"},
      {"name:[a TO b]", "takes no range"},
      {"type:kind.spreadsheet", "unknown type"},
      {"path.real.fulltext:\"sub/dir\"", "absolute folder"},
  };
  for (const Row& r : meaning) {
    try {
      Tree(r.query);
      ADD_FAILURE() << r.query << " translated";
    } catch (const RequestError& e) {
      EXPECT_EQ(e.type(), "query_shard_exception");
      EXPECT_NE(std::string(e.what()).find(r.says), std::string::npos)
          << r.query << ": " << e.what();
    }
  }
  // Nesting is bounded, so a hostile query costs an error, not the stack.
  EXPECT_THROW(ParseQueryString(std::string(100000, '(') + "a"), QuerySyntaxError);
  std::string nots;
  for (int i = 0; i < 50000; ++i) nots += "NOT ";
  EXPECT_THROW(ParseQueryString(nots + "a"), QuerySyntaxError);
}

// Every attribute and content type of the shipped mappings file, as the file server writes it
// into a query, is one the gateway reads.
TEST(QueryStringTest, TheShippedMappingsFileNamesOnlyWhatTheGatewayReads) {
  Json::Value mappings;
  std::string errors;
  ASSERT_TRUE(JsonParseChecked(test::ReadFile(SEARCHGW_MAPPINGS), &mappings, &errors)) << errors;
  const Json::Value& attributes = mappings["attribute_mappings"];
  ASSERT_GE(attributes.size(), 15u);
  for (const std::string& name : attributes.getMemberNames()) {
    const std::string type = attributes[name]["type"].asString();
    const std::string field = attributes[name]["attribute"].asString();
    std::string query = "x";
    if (type == "str") query = field + ":*x*";
    if (type == "num") query = field + ":{1 TO *}";
    if (type == "date") query = field + ":[2024-01-01T00\\:00\\:00Z TO 2024-02-01T00:00:00Z]";
    if (type == "type") query = field + ":(ext.pdf)";
    EXPECT_NO_THROW(Tree(query)) << name << ": " << query;
  }
  for (const std::string& id : mappings["mime_mappings"].getMemberNames()) {
    EXPECT_NO_THROW(Tree("type:(" + mappings["mime_mappings"][id].asString() + ")")) << id;
  }
}

TEST(SearchBodyTest, BothRequestShapesAreRead) {
  SearchRequest old_shape = ReadSearchBody(
      R"({"from": 50, "size": 50, "_source": ["path.real"], "query": {"query_string": )"
      R"({"query": "(name:*foo*) AND path.real.fulltext:\"/srv/s\""}}})");
  EXPECT_EQ(old_shape.from, 50);
  EXPECT_EQ(old_shape.size, 50);
  EXPECT_EQ(JsonToString(old_shape.query),
            R"({"and":[{"match":"name","pattern":"*foo*"},{"under":"/srv/s"}]})");

  SearchRequest new_shape = ReadSearchBody(
      R"({"query": {"bool": {"filter": [{"prefix": {"path.real": "/srv/s/"}}],)"
      R"( "must": {"query_string": {"query": "content:bar", "fields": ["content"]}}}}})");
  EXPECT_EQ(new_shape.from, 0);
  EXPECT_EQ(new_shape.size, 10);
  EXPECT_EQ(JsonToString(new_shape.query),
            R"({"and":[{"under":"/srv/s"},{"match":"content","pattern":"bar"}]})");

  // The listed fields are where a term without a field is searched; a boost changes nothing.
  EXPECT_EQ(JsonToString(ReadSearchBody(R"({"query": {"query_string": {"query": "foo AND size:1",)"
                                        R"( "fields": ["name^2", "title"]}}})")
                             .query),
            R"({"and":[{"or":[{"match":"name","pattern":"foo"},{"match":"title","pattern":"foo"}]},)"
            R"({"gte":1,"lte":1,"range":"size"}]})");

  EXPECT_EQ(JsonToString(ReadSearchBody("{}").query), R"({"all":true})");
  EXPECT_EQ(JsonToString(ReadSearchBody(R"({"query": {"bool": {"must_not": {"match_all": {}},)"
                                        R"( "should": [{"prefix": {"name": "ab"}}]}}})")
                             .query),
            R"({"and":[{"not":{"all":true}},{"match":"name","pattern":"ab*"}]})");

  struct Row {
    const char* body;
    const char* type;
  };
  const Row bad[] = {
      {"not json", "parsing_exception"},
      {"[1]", "parsing_exception"},
      {R"({"size": -1})", "parsing_exception"},
      {R"({"from": "0"})", "parsing_exception"},
      {R"({"size": 1001})", "illegal_argument_exception"},
      {R"({"query": {"term": {"name": "x"}}})", "parsing_exception"},
      {R"({"query": {"query_string": {"query": "a AND"}}})", "parsing_exception"},
      {R"({"query": {"query_string": {"query": "nope:x"}}})", "query_shard_exception"},
      {R"({"query": {"bool": {"must": 3}}})", "parsing_exception"},
      {R"({"query": {"query_string": {"query": "x", "fields": "name"}}})", "parsing_exception"},
      {R"({"query": {"query_string": {"query": "x", "fields": ["nope"]}}})",
       "query_shard_exception"},
  };
  for (const Row& r : bad) {
    try {
      ReadSearchBody(r.body);
      ADD_FAILURE() << r.body << " was read";
    } catch (const RequestError& e) {
      EXPECT_EQ(e.type(), r.type) << r.body << ": " << e.what();
    }
  }
}

TEST(SearchBodyTest, IndexListsTimesAndTheReplyBound) {
  EXPECT_TRUE(ReadIndexList("_all").empty());
  EXPECT_EQ(ReadIndexList("fileindex_a,fileindex_b"),
            (std::vector<std::string>{"fileindex_a", "fileindex_b"}));
  EXPECT_THROW(ReadIndexList("other"), RequestError);
  EXPECT_THROW(ReadIndexList("fileindex_a,"), RequestError);

  int64_t t = 0;
  EXPECT_TRUE(ParseUtcTime("1970-01-02", &t));
  EXPECT_EQ(t, 86400);
  EXPECT_TRUE(ParseUtcTime("1700000000", &t));
  EXPECT_EQ(t, 1700000000);
  for (const char* bad : {"2024-13-01", "2024-01-01T10:00", "2024-01-01T10:00:00+02:00", "x"}) {
    EXPECT_FALSE(ParseUtcTime(bad, &t)) << bad;
  }

  // Long paths fill the reply before the page does: it stops short of the bound, and what it
  // holds is still whole JSON.
  Json::Value data(Json::objectValue);
  data["total"] = 500;
  for (int i = 0; i < 500; ++i) {
    data["hits"][i]["path"] = "/srv/share/" + std::string(1000, 'a') + std::to_string(i);
  }
  const std::string reply = BuildSearchReply(data);
  EXPECT_LE(reply.size(), kMaxReplyBytes);
  Json::Value parsed;
  std::string errors;
  ASSERT_TRUE(JsonParseChecked(reply, &parsed, &errors)) << errors;
  EXPECT_EQ(parsed["hits"]["total"]["value"].asInt(), 500);
  EXPECT_GT(parsed["hits"]["hits"].size(), 300u);
  EXPECT_EQ(parsed["hits"]["hits"][0]["_source"]["path"]["real"].asString(),
            data["hits"][0]["path"].asString());
}

}  // namespace
}  // namespace searchgw
}  // namespace orvane
