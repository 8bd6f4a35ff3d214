#include "fileindex/elastic_control.hpp"

#include <fcntl.h>
#include <syslog.h>
#include <unistd.h>

#include <algorithm>
#include <fstream>
#include <set>

#include "common/comm.hpp"
#include "common/error.hpp"
#include "common/json_util.hpp"
#include "common/log.hpp"
#include "common/sdk/share.hpp"
#include "common/util.hpp"
#include "extract/content_extract.hpp"
#include "fileindex/folder_mgr.hpp"
#include "fileindex/status_mgr.hpp"
#include "fileindex/util.hpp"
#include "platform/fileidx.hpp"
#include "platform/safe_dir.hpp"

namespace orvane {
namespace fileindex {
namespace elastic {
namespace {

namespace ce = QUIX::CONTENT_EXTRACT;

// The schema: "default" holds what every field has unless it says otherwise; each property lists
// only what differs. The engine's vocabulary is passed as it stands.
const std::string& MappingsText() {
  static const std::string text = R"json(
{
	"property_id": "QUIXMDPath",
	"default": {"type": "string", "analyzer": "quixstandard", "required": false, "stored": true, "_all": true},
	"properties": {
		"QUIXMDPath": {"analyzer": "keyword", "required": true, "_all": false},
		"QUIXMDFSName": {"analyzer": "keyword", "_all": false},
		"QUIXMDPrivilege": {"analyzer": "keyword", "_all": false},
		"QUIXMDIsDir": {"type": "bool", "_all": false},
		"QUIXMDOwnerUserID": {"analyzer": "keyword", "_all": false},
		"QUIXMDOwnerGroupID": {"analyzer": "keyword", "_all": false},
		"QUIXMDFSSize": {"type": "int"},
		"QUIXMDFSContentChangeDate": {"type": "int"},
		"QUIXMDAttributeChangeDate": {"type": "int"},
		"QUIXMDFSCreationDate": {"type": "int"},
		"QUIXMDContentModificationDate": {"type": "int"},
		"QUIXMDLastUsedDate": {"type": "int"},
		"QUIXMDContentCreationDate": {"type": "int"},
		"QUIXMDAuthors": {"type": "text", "analyzer": "white space"},
		"QUIXMDTitle": {"type": "text"},
		"QUIXMDAlbum": {"type": "text"},
		"QUIXMDIdentifier": {"type": "text", "analyzer": "keyword", "_all": false},
		"QUIXMDAudioTrackNumber": {"type": "int"},
		"QUIXMDRecordingYear": {"type": "int"},
		"QUIXMDCreator": {"type": "text", "analyzer": "white space"},
		"QUIXMDMusicalGenre": {"type": "text"},
		"QUIXMDComposer": {"type": "text", "analyzer": "white space"},
		"QUIXMDComment": {"type": "text"},
		"QUIXMDDurationSecond": {"type": "double"},
		"QUIXMDAudioBitRate": {"type": "int"},
		"QUIXMDTotalBitRate": {"type": "int"},
		"QUIXMDVideoBitRate": {"type": "int"},
		"QUIXMDAudioSampleRate": {"type": "int"},
		"QUIXMDAudioChannelCount": {"type": "int"},
		"QUIXMDISOSpeed": {"type": "int"},
		"QUIXMDCodecs": {"type": "text", "analyzer": "white space"},
		"QUIXMDDescription": {"type": "text"},
		"QUIXMDAcquisitionMake": {"type": "text", "analyzer": "white space"},
		"QUIXMDAcquisitionModel": {"type": "text", "analyzer": "white space"},
		"QUIXMDExposureTimeString": {"analyzer": "keyword"},
		"QUIXMDAperture": {"analyzer": "keyword"},
		"QUIXMDResolutionWidthDPI": {"type": "int"},
		"QUIXMDResolutionHeightDPI": {"type": "int"},
		"QUIXMDPixelWidth": {"type": "int"},
		"QUIXMDPixelHeight": {"type": "int"},
		"QUIXMDMediaTypes": {"analyzer": "keyword"},
		"QUIXMDParent": {"analyzer": "keyword", "_all": false},
		"QUIXMDExtension": {"analyzer": "keyword", "_all": false},
		"QUIXMDTextContent": {"type": "text"},
		"QUIXMDKeywords": {},
		"QUIXMDFinderLabel": {"type": "int"},
		"QUIXMDGroupId": {"analyzer": "keyword"},
		"QUIXMDFinderOpenDate": {"type": "int"},
		"QUIXMDLogicalSize": {"type": "int"},
		"QUIXMDPhysicalSize": {"type": "int"},
		"QUIXMDDateAdded": {"type": "int"},
		"QUIXMDSearchFileName": {"type": "text", "analyzer": "white space", "preprocess": ["tolower", "ngram"]},
		"QUIXMDSearchAncestor": {"type": "text", "analyzer": "white space escaped", "_all": false, "preprocess": ["list_ancestor"]},
		"QUIXMDStarRating": {"analyzer": "keyword"},
		"_QUIXMDUserTags": {"type": "text"},
		"QUIXMDSpotlightBoost": {"type": "text", "analyzer": "white space"},
		"QUIXMDIsEncrypted": {"type": "bool", "_all": false}
	}
}
)json";
  return text;
}

const std::string& EventHandlerText() {
  static const std::string text =
      std::string("{\"lib_path\": \"") + kFileIndexEventHandlerPath + "\"}";
  return text;
}

Json::Value Command(const std::string& command, const std::string& id) {
  Json::Value req(Json::objectValue);
  req["command"] = command;
  req["data"]["id"] = id;
  return req;
}

Json::Value PrefixQuery(const std::string& dir) {
  Json::Value query(Json::objectValue);
  query["qsl"]["prefix"][ce::QUIXMDPath] = dir + "/";
  return query;
}

// Sends a query for the command `func` and checks that its reply carries the hits. A reply
// that got this far is an object: the exchange refuses anything else.
void SendQuery(Json::Value& res, const Json::Value& req, const char* func) {
  SendRequest(res, req);
  ORVANE_THROW_IF_IN(func, !res.isMember("data") || !res["data"].isArray(), kErrNoQueryData,
                     JsonToString(res));
}

ParseFileFn& ParseFileOverride() {
  static ParseFileFn parse_file;
  return parse_file;
}

// Extraction of `path` into `doc`; whatever it throws is a file that could not be parsed.
bool ParseFile(const std::string& path, const Json::Value& config, Json::Value& doc) {
  try {
    const ParseFileFn& parse_file = ParseFileOverride();
    if (parse_file) {
      parse_file(path, config, doc);
    } else {
      ce::ParseFile(path, config, doc);
    }
    return true;
  } catch (...) {
    return false;
  }
}

// The document of `path` as extraction gives it, with the two fields the engine searches names
// and folders by.
Json::Value ParseDocument(const std::string& path, bool need_meta, const char* func) {
  Json::Value config(Json::objectValue);
  config[ce::kKeyNeedMeta] = need_meta;
  Json::Value doc;
  ORVANE_THROW_IF_IN(func, !ParseFile(path, config, doc), kErrParseFile,
                     "Parse failed, path=" + path);
  doc[ce::QUIXMDSearchFileName] = doc[ce::QUIXMDFSName];
  doc[ce::QUIXMDSearchAncestor] = doc[ce::QUIXMDParent];
  return doc;
}

}  // namespace

ParseFileFn SetParseFile(ParseFileFn parse_file) {
  std::swap(ParseFileOverride(), parse_file);
  return parse_file;
}

std::string GetFileIndexID(const std::string& share) { return platform::ComposeIndexID(share); }

Json::Value GetFileIndexSettings() { return Json::Value(Json::objectValue); }

Json::Value GetFileIndexMappings() {
  const std::string& mappings = MappingsText();
  JsonValue ret;
  ORVANE_THROW_IF(!ret.fromString(mappings), kErrSystem, "");
  return ret;
}

Json::Value GetFileIndexEventHandler() {
  const std::string& event_handler = EventHandlerText();
  JsonValue ret;
  ORVANE_THROW_IF(!ret.fromString(event_handler), kErrSystem, "");
  return ret;
}

void ShareIndexCreate(const std::string& share) {
  Json::Value req = Command("index_create", GetFileIndexID(share));
  req["data"]["path"] = sdk::SDKShare(share).GetDBPath();
  req["data"]["settings"] = GetFileIndexSettings();
  req["data"]["mappings"] = GetFileIndexMappings();
  req["data"]["event_handler"] = GetFileIndexEventHandler();
  SendRequest(req);
}

void ShareIndexDelete(const std::string& share) {
  SendRequest(Command("index_delete", GetFileIndexID(share)));
}

void ShareIndexPause(const std::string& share) {
  SendRequest(Command("index_pause", GetFileIndexID(share)));
}

void ShareIndexResume(const std::string& share) {
  SendRequest(Command("index_resume", GetFileIndexID(share)));
}

void ShareIndexRename(const std::string& old_share, const std::string& new_share,
                      const std::string& db_path) {
  Json::Value req = Command("index_config_set", GetFileIndexID(old_share));
  req["data"]["data"]["id"] = GetFileIndexID(new_share);
  req["data"]["data"]["path"] = db_path;
  SendRequest(req);
}

void ShareIndexMigrate(const std::string& share, const std::string& db_path) {
  Json::Value req = Command("index_config_set", GetFileIndexID(share));
  req["data"]["data"]["path"] = db_path;
  SendRequest(req);
}

void IndexUpsert(const std::string& share, const std::string& path, bool need_meta) {
  Json::Value req = Command("document_upsert_by_id", GetFileIndexID(share));
  req["data"]["doc_id"] = path;
  req["data"]["data"] = ParseDocument(path, need_meta, __func__);
  SendRequest(req);
}

void IndexDel(const std::string& share, const std::string& path) {
  Json::Value req = Command("document_del_by_id", GetFileIndexID(share));
  req["data"]["doc_id"] = path;
  SendRequest(req);
}

void IndexDelDir(const std::string& share, const std::string& dir) {
  Json::Value req = Command("document_del_by_query", GetFileIndexID(share));
  req["data"]["query"] = PrefixQuery(dir);
  SendRequest(req);
}

void IndexAttr(const std::string& share, const std::string& path) {
  if (!IsDocumentExists(share, path)) throw Error(kErrNoDocument);
  Json::Value req = Command("document_set_by_id", GetFileIndexID(share));
  req["data"]["doc_id"] = path;
  req["data"]["data"] = ParseDocument(path, false, __func__);
  SendRequest(req);
}

bool IsDocumentExists(const std::string& share, const std::string& path) {
  Json::Value req = Command("document_get_by_query", GetFileIndexID(share));
  req["data"]["query"]["qsl"]["term"][ce::QUIXMDPath] = path;
  Json::Value res;
  SendQuery(res, req, __func__);
  return !res["data"].empty();
}

void IndexGetByPrefixPath(const std::string& db_name, const std::string& dir,
                          std::vector<std::string>& paths) {
  Json::Value req = Command("document_get_by_query", db_name);
  req["data"]["query"] = PrefixQuery(dir);
  req["data"]["query"]["load_field"].append(ce::QUIXMDPath);
  Json::Value res;
  SendQuery(res, req, __func__);
  for (const Json::Value& hit : res["data"]) {
    if (!hit.isObject()) continue;
    const Json::Value* path = hit.find(ce::QUIXMDPath, ce::QUIXMDPath + sizeof(ce::QUIXMDPath) - 1);
    if (path != nullptr && isJsonType<std::string>(*path)) paths.push_back(path->asString());
  }
}

void IndexCommit(const std::string& share) {
  try {
    SendRequest(Command("commit", GetFileIndexID(share)));
  } catch (const Error&) {
    const bool space_enough = sdk::SDKShare(share).IsSpaceEnough();
    if (!space_enough) StatusMgr().SetShareStatus(share, 1);
    ORVANE_THROW_IF(!space_enough, kErrSpaceNotEnough, "Share (" + share + ") space not enough");
    throw;
  }
}

void IndexRename(const std::string& share, const std::string& new_path,
                 const std::string& old_path) {
  const std::string id = GetFileIndexID(share);
  const std::string name = Basename(new_path);
  const std::string ext = GetFileExtension(new_path, true);
  const std::string parent = Dirname(new_path);
  if (!IsDocumentExists(share, old_path)) throw Error(kErrNoDocument);

  // One request object serves every step and is never cleared: the members of earlier steps
  // ride along in later requests, and the engine ignores what a command does not use.
  Json::Value req = Command("document_set_by_id", id);
  req["data"]["doc_id"] = old_path;
  Json::Value& fields = req["data"]["data"];
  fields[ce::QUIXMDPath] = new_path;
  fields[ce::QUIXMDParent] = parent;
  fields[ce::QUIXMDFSName] = name;
  fields[ce::QUIXMDSearchFileName] = name;
  fields[ce::QUIXMDSearchAncestor] = parent;
  fields[ce::QUIXMDDisplayName] = name;
  fields[ce::QUIXMDKind] = ext;
  fields[ce::QUIXMDExtension] = ext;
  SendRequest(req);

  for (;;) {
    req["command"] = "document_get_by_query";
    req["data"]["id"] = id;
    Json::Value& query = req["data"]["query"];
    query["qsl"]["prefix"][ce::QUIXMDPath] = old_path + "/";
    query["load_field"].append(ce::QUIXMDPath);
    query["load_field"].append(ce::QUIXMDFSName);
    query["load_field"].append(ce::QUIXMDParent);
    query["from"] = 0;
    query["size"] = kRenameBatchSize;
    Json::Value res;
    SendQuery(res, req, __func__);
    const Json::Value& hits = res["data"];
    if (hits.empty()) return;

    Json::Value compound(Json::objectValue);
    Json::Value& subs = compound["compound"] = Json::Value(Json::arrayValue);
    for (const Json::Value& hit : hits) {
      std::string hit_name;
      std::string hit_parent;
      GetJsonValue(hit_name, hit, ce::QUIXMDFSName, true);
      GetJsonValue(hit_parent, hit, ce::QUIXMDParent, true);
      const std::string new_parent = std::string(hit_parent).replace(0, old_path.size(), new_path);
      req["command"] = "document_set_by_id";
      req["data"]["id"] = id;
      req["data"]["doc_id"] = hit[ce::QUIXMDPath];
      Json::Value& hit_fields = req["data"]["data"] = Json::Value(Json::objectValue);
      hit_fields[ce::QUIXMDParent] = new_parent;
      hit_fields[ce::QUIXMDPath] = new_parent + "/" + hit_name;
      hit_fields[ce::QUIXMDSearchFileName] = hit_name;
      hit_fields[ce::QUIXMDSearchAncestor] = new_parent;
      subs.append(req);
    }
    SendRequest(compound);
    if (hits.size() < kRenameBatchSize) return;
    // Re-pathed documents stop matching the old prefix only once committed; the next pass starts
    // at 0 again.
    IndexCommit(share);
  }
}

void ListUnAvailTermSuggDB(std::vector<std::string>& dbs) {
  Json::Value req(Json::objectValue);
  req["command"] = "list_term_sugg_db";
  req["data"] = Json::Value(Json::objectValue);
  Json::Value res;
  SendRequest(res, req);
  const Json::Value& data = res["data"];
  if (!data.isObject() || !data["unavail"].isArray()) return;
  for (const Json::Value& db : data["unavail"]) {
    if (isJsonType<std::string>(db)) dbs.push_back(db.asString());
  }
}

void UpdateTermSuggestion(const std::string& db_name, const std::vector<std::string>& paths) {
  Json::Value req(Json::objectValue);
  Json::Value& subs = req["compound"] = Json::Value(Json::arrayValue);
  for (const std::string& path : paths) {
    Json::Value sub(Json::objectValue);
    sub["command"] = "update_term_suggestion";
    sub["data"]["doc_id_field"] = path;
    sub["data"]["db_name"] = db_name;
    subs.append(sub);
  }
  SendRequest(req);
}

}  // namespace elastic

void UpdateTermSuggestion() {
  FolderMgr folders;
  std::vector<std::string> dbs;
  elastic::ListUnAvailTermSuggDB(dbs);
  const std::set<std::string> shares = folders.GetIndexedShares();

  std::vector<std::string> paths;
  for (const std::string& share : shares) {
    sdk::SDKShare sdk_share(share);
    const std::string db = sdk_share.GetDBName();
    if (std::find(dbs.begin(), dbs.end(), db) == dbs.end()) continue;
    ORVANE_LOG(LOG_ERR, "Start building term sugg [%s]", db.c_str());
    // The marker lies among the engine's own files, so it is written like them: through the
    // folder's descriptor, root-only, never through a link.
    const platform::SafeDir db_dir = platform::SafeDir::Open(sdk_share.GetDBPath(), false);
    const std::string marker = kTermSuggRunningMarker + 1;  // without its leading "/"
    ORVANE_LOG_IF(!db_dir.valid() ||
                  !db_dir.OpenFile(marker, O_WRONLY | O_CREAT | O_TRUNC).valid());
    paths.clear();
    elastic::IndexGetByPrefixPath(db, sdk_share.GetPath(), paths);
    elastic::UpdateTermSuggestion(db, paths);
    elastic::IndexCommit(share);
    ORVANE_LOG(LOG_ERR, "Done building term sugg [%s]", db.c_str());
    ORVANE_LOG_IF(!db_dir.valid() || 0 != db_dir.Unlink(marker));
  }
}

}  // namespace fileindex
}  // namespace orvane
