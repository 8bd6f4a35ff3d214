// The search-index binding: one index per indexed share in the search-engine daemon, its field
// schema, the index lifecycle and document commands, and the rebuild of term suggestions. Every
// command is one request through the engine channel's retry policy; nothing is kept between
// calls, so any thread may call; concurrent commands on one share are ordered by the engine only.
#ifndef ORVANE_FILEINDEX_ELASTIC_CONTROL_HPP_
#define ORVANE_FILEINDEX_ELASTIC_CONTROL_HPP_

#include <json/json.h>

#include <functional>
#include <string>
#include <vector>

namespace orvane {
namespace fileindex {
namespace elastic {

// Documents a rename re-paths per query pass; the engine gets a commit between passes.
constexpr unsigned int kRenameBatchSize = 10000;
// The engine plug-in that handles the index's events (a file of the package).
constexpr char kFileIndexEventHandlerPath[] =
    "/var/packages/Orvane/target/handler/fileindex_event_handler.so";

// "fileindex_" + share, unchanged.
std::string GetFileIndexID(const std::string& share);
// An empty object.
Json::Value GetFileIndexSettings();
// The field schema, parsed from its built-in text on every call. Throws Error 502 if it does not
// parse.
Json::Value GetFileIndexMappings();
// {"lib_path": kFileIndexEventHandlerPath}. Throws Error 502 if it does not parse.
Json::Value GetFileIndexEventHandler();

// Index lifecycle. Throw the engine channel's Error; ShareIndexCreate also the share adapter's.
void ShareIndexCreate(const std::string& share);
void ShareIndexDelete(const std::string& share);
void ShareIndexPause(const std::string& share);
void ShareIndexResume(const std::string& share);
// Re-keys the index of `old_share` under `new_share`'s id and points it at `db_path`.
void ShareIndexRename(const std::string& old_share, const std::string& new_share,
                      const std::string& db_path);
// Points the index of `share` at `db_path`, keeping its id.
void ShareIndexMigrate(const std::string& share, const std::string& db_path);

// Adds or replaces the document of `path` (a full path). Throws Error 914 when extraction fails.
void IndexUpsert(const std::string& share, const std::string& path, bool need_meta);
void IndexDel(const std::string& share, const std::string& path);
// Deletes every document below `dir`; the directory's own document stays.
void IndexDelDir(const std::string& share, const std::string& dir);
// Refreshes the file-system fields of an indexed document. Throws Error 917 when `path` has no
// document, 914 when extraction fails.
void IndexAttr(const std::string& share, const std::string& path);
// Moves the document of `old_path` and every document below it to `new_path`, in passes of
// kRenameBatchSize with a commit between passes. Throws Error 917 when `old_path` has no
// document, 916 when a query reply has no "data" array.
void IndexRename(const std::string& share, const std::string& new_path,
                 const std::string& old_path);
// Appends to `paths` the paths of documents below `dir` in index `db_name` (one page of the
// engine's default size). Throws Error 916 when the reply has no "data" array.
void IndexGetByPrefixPath(const std::string& db_name, const std::string& dir,
                          std::vector<std::string>& paths);
// Makes the share's pending changes durable. When the commit fails on a share short of space,
// records status 1 for the share and throws Error 1003; otherwise rethrows the commit's Error.
void IndexCommit(const std::string& share);
// Whether `path` has a document. Throws Error 916 when the reply has no "data" array.
bool IsDocumentExists(const std::string& share, const std::string& path);

// Appends the names of the databases whose term-suggestion store is unavailable.
void ListUnAvailTermSuggDB(std::vector<std::string>& dbs);
// Asks the engine to update the suggestions of `db_name` from the documents `paths`, in one
// compound request.
void UpdateTermSuggestion(const std::string& db_name, const std::vector<std::string>& paths);

// The content extraction the document commands call (the platform's ParseFile unless replaced).
// Tests replace it to see the configuration passed and to make extraction fail; swap it only
// while no command runs. An empty function restores the platform's. Returns the one replaced.
using ParseFileFn =
    std::function<void(const std::string& path, const Json::Value& config, Json::Value& doc)>;
ParseFileFn SetParseFile(ParseFileFn parse_file);

}  // namespace elastic

// The marker file, below a share's index database folder, present while its suggestions are
// rebuilt.
constexpr char kTermSuggRunningMarker[] = "/term.sugg.running";

// Rebuilds the term suggestions of every indexed share whose store the engine reports as
// unavailable, one share at a time in name order. The first Error ends it (a marker file may
// then stay behind).
void UpdateTermSuggestion();

}  // namespace fileindex
}  // namespace orvane

#endif  // ORVANE_FILEINDEX_ELASTIC_CONTROL_HPP_
