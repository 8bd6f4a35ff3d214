#include "daemons/searchgw/search_request.hpp"

#include <time.h>

#include <cerrno>
#include <cmath>
#include <cstdlib>
#include <cstring>
#include <memory>

#include "common/json_util.hpp"
#include "common/name_codec.hpp"
#include "platform/fileidx.hpp"

namespace orvane {
namespace searchgw {
namespace {

const char kParsing[] = "parsing_exception";
const char kBadQuery[] = "query_shard_exception";

enum class FieldKind { kText, kNumber, kDate, kType, kFolder };
struct Field {
  const char* name;
  FieldKind kind;
  const char* target;  // the engine's name for it
};

// The fields a query may name: the attributes the shipped Spotlight mappings file uses, and the
// path field every client sends for a folder scope. Text and number fields are the engine's own.
constexpr Field kFields[] = {
    {"", FieldKind::kText, "any"},
    {"*", FieldKind::kText, "any"},
    {"name", FieldKind::kText, "name"},
    {"content", FieldKind::kText, "content"},
    {"path", FieldKind::kText, "path"},
    {"title", FieldKind::kText, "title"},
    {"authors", FieldKind::kText, "authors"},
    {"album", FieldKind::kText, "album"},
    {"composer", FieldKind::kText, "composer"},
    {"genre", FieldKind::kText, "genre"},
    {"comment", FieldKind::kText, "comment"},
    {"description", FieldKind::kText, "description"},
    {"keywords", FieldKind::kText, "keywords"},
    {"creator", FieldKind::kText, "creator"},
    {"camera_make", FieldKind::kText, "camera_make"},
    {"camera_model", FieldKind::kText, "camera_model"},
    {"codecs", FieldKind::kText, "codecs"},
    {"size", FieldKind::kNumber, "size"},
    {"duration", FieldKind::kNumber, "duration"},
    {"pixel_height", FieldKind::kNumber, "pixel_height"},
    {"pixel_width", FieldKind::kNumber, "pixel_width"},
    {"year", FieldKind::kNumber, "year"},
    {"track", FieldKind::kNumber, "track"},
    {"audio_bit_rate", FieldKind::kNumber, "audio_bit_rate"},
    {"sample_rate", FieldKind::kNumber, "sample_rate"},
    {"channels", FieldKind::kNumber, "channels"},
    {"iso_speed", FieldKind::kNumber, "iso_speed"},
    {"mtime", FieldKind::kDate, "mtime"},
    {"ctime", FieldKind::kDate, "ctime"},
    {"crtime", FieldKind::kDate, "crtime"},
    {"content_created", FieldKind::kDate, "content_created"},
    {"type", FieldKind::kType, ""},
    {"path.real", FieldKind::kFolder, ""},
    {"path.real.fulltext", FieldKind::kFolder, ""},
};

const char* const kKinds[] = {"document", "audio", "video", "photo", "folder", "other"};

const Field& FindField(const std::string& name) {
  for (const Field& f : kFields) {
    if (name == f.name) return f;
  }
  std::string known;
  for (const Field& f : kFields) {
    if (std::strlen(f.name) > 1) known += std::string(known.empty() ? "" : ", ") + f.name;
  }
  throw RequestError(kBadQuery, "unknown field \"" + name + "\": the fields are " + known);
}

Json::Value Node(const char* op, Json::Value value) {
  Json::Value n(Json::objectValue);
  n[op] = std::move(value);
  return n;
}

Json::Value Match(const char* target, const std::string& pattern) {
  Json::Value n(Json::objectValue);
  n["match"] = target;
  n["pattern"] = pattern;
  return n;
}

Json::Value Under(std::string folder, const std::string& field) {
  // "/a/b/" and "/a/b/*" both stand for the folder itself.
  if (!folder.empty() && folder.back() == '*') folder.pop_back();
  while (folder.size() > 1 && folder.back() == '/') folder.pop_back();
  if (folder.empty() || folder[0] != '/' || folder.find('*') != std::string::npos) {
    throw RequestError(
        kBadQuery, "the value of " + field + " must be an absolute folder, not \"" + folder + "\"");
  }
  return Node("under", EncodeName(folder));
}

// A bound of a numeric or time field as the engine takes it.
Json::Value Bound(const Field& f, const std::string& text) {
  if (f.kind == FieldKind::kDate) {
    int64_t seconds = 0;
    if (!ParseUtcTime(text, &seconds)) {
      throw RequestError(kBadQuery, "\"" + text + "\" is not a time for " + f.name +
                                        ": give an ISO-8601 UTC time such as "
                                        "2024-05-01T10:20:30Z");
    }
    return Json::Int64(seconds);
  }
  char* end = nullptr;
  errno = 0;
  const double v = std::strtod(text.c_str(), &end);
  if (text.empty() || *end != '\0' || errno != 0 || !std::isfinite(v)) {
    throw RequestError(kBadQuery, "\"" + text + "\" is not a number for " + f.name);
  }
  if (v == std::floor(v) && std::fabs(v) < 9.0e15) return Json::Int64(static_cast<int64_t>(v));
  return v;
}

Json::Value Range(const Field& f, const std::string& low, bool low_in, const std::string& high,
                  bool high_in) {
  Json::Value n(Json::objectValue);
  n["range"] = f.target;
  if (low != "*") n[low_in ? "gte" : "gt"] = Bound(f, low);
  if (high != "*") n[high_in ? "lte" : "lt"] = Bound(f, high);
  if (n.size() == 1) return Node("all", true);
  return n;
}

// A type value: "kind.photo" or "ext.pdf", as the mappings file's content types spell them;
// several of them, separated by spaces, are any of them.
Json::Value TypeValues(const std::string& text) {
  Json::Value parts(Json::arrayValue);
  size_t start = 0;
  while (start < text.size()) {
    size_t end = text.find(' ', start);
    if (end == std::string::npos) end = text.size();
    const std::string value = text.substr(start, end - start);
    start = end + 1;
    if (value.empty()) continue;
    const size_t dot = value.find('.');
    const std::string what = value.substr(0, dot);
    const std::string v = dot == std::string::npos ? "" : value.substr(dot + 1);
    bool ok = !v.empty() && v.find('*') == std::string::npos;
    if (ok && what == "kind") {
      ok = false;
      for (const char* k : kKinds) ok = ok || v == k;
    } else if (what != "ext") {
      ok = false;
    }
    if (!ok) {
      throw RequestError(kBadQuery, "unknown type \"" + value +
                                        "\": a type is kind.document, kind.audio, kind.video, "
                                        "kind.photo, kind.folder, kind.other or ext.EXTENSION");
    }
    Json::Value n(Json::objectValue);
    n["in"] = what;
    n["values"].append(v);
    parts.append(std::move(n));
  }
  if (parts.empty()) throw RequestError(kBadQuery, "a type query names no type");
  return parts.size() == 1 ? parts[0] : Node("or", std::move(parts));
}

Json::Value Leaf(const QueryNode& q, const std::vector<std::string>& fields) {
  if (q.field.empty() && !fields.empty()) {
    // A term without a field searches the fields the request lists, any of them.
    Json::Value parts(Json::arrayValue);
    for (const std::string& name : fields) {
      QueryNode named = q;
      named.field = name;
      parts.append(Leaf(named, {}));
    }
    return parts.size() == 1 ? parts[0] : Node("or", std::move(parts));
  }
  const Field& f = FindField(q.field);
  const std::string& text = q.text;
  switch (f.kind) {
    case FieldKind::kText:
      return Match(f.target, text);
    case FieldKind::kFolder:
      return Under(text, f.name);
    case FieldKind::kType:
      return TypeValues(text);
    case FieldKind::kNumber:
    case FieldKind::kDate:
      if (q.kind == QueryNode::kTerm && text == "*") return Node("all", true);
      return Range(f, text, true, text, true);
  }
  return Json::Value();
}

Json::Value ReadJsonQuery(const Json::Value& q, int depth);

// One or several queries of a bool member, each translated.
void AppendClauses(const Json::Value& v, const char* member, int depth, Json::Value* out) {
  if (v.isObject()) {
    out->append(ReadJsonQuery(v, depth + 1));
  } else if (v.isArray()) {
    for (const Json::Value& c : v) out->append(ReadJsonQuery(c, depth + 1));
  } else {
    throw RequestError(kParsing,
                       std::string("bool.") + member + " must be a query or a list of them");
  }
}

Json::Value Combine(const char* op, Json::Value parts) {
  if (parts.size() == 1) return parts[0];
  return Node(op, std::move(parts));
}

Json::Value ReadJsonQuery(const Json::Value& q, int depth) {
  if (depth > 32) throw RequestError(kParsing, "the query nests too deeply");
  if (!q.isObject() || q.size() != 1) {
    throw RequestError(kParsing, "a query must be an object with one member naming its kind");
  }
  const std::string kind = q.getMemberNames().front();
  const Json::Value& body = q[kind];
  if (kind == "match_all") return Node("all", true);
  if (kind == "query_string") {
    const Json::Value& text = body["query"];
    if (!body.isObject() || !text.isString()) {
      throw RequestError(kParsing, "query_string needs a \"query\" text");
    }
    const Json::Value& listed = body["fields"];
    if (!listed.isNull() && !listed.isArray()) {
      throw RequestError(kParsing, "query_string.fields must be a list of field names");
    }
    std::vector<std::string> fields;
    for (const Json::Value& name : listed) {
      if (!name.isString()) {
        throw RequestError(kParsing, "query_string.fields must be a list of field names");
      }
      // A boost ("name^2") weighs a field; hits are not ranked here, so it changes nothing.
      std::string field = name.asString().substr(0, name.asString().find('^'));
      FindField(field);
      fields.push_back(std::move(field));
    }
    try {
      return TranslateQuery(ParseQueryString(text.asString()), fields);
    } catch (const QuerySyntaxError& e) {
      throw RequestError(kParsing, std::string("cannot parse query_string: ") + e.what());
    }
  }
  if (kind == "prefix") {
    if (!body.isObject() || body.size() != 1) {
      throw RequestError(kParsing, "prefix needs one field and its value");
    }
    const std::string field = body.getMemberNames().front();
    Json::Value value = body[field];
    if (value.isObject()) value = value["value"];
    if (!value.isString()) throw RequestError(kParsing, "the prefix of " + field + " must be text");
    const Field& f = FindField(field);
    if (f.kind == FieldKind::kFolder) return Under(value.asString(), field);
    if (f.kind == FieldKind::kText) return Match(f.target, value.asString() + "*");
    throw RequestError(kBadQuery, "field " + field + " takes no prefix");
  }
  if (kind == "bool") {
    if (!body.isObject()) throw RequestError(kParsing, "bool must be an object");
    Json::Value all(Json::arrayValue), any(Json::arrayValue);
    for (const std::string& member : body.getMemberNames()) {
      const Json::Value& v = body[member];
      if (member == "must" || member == "filter") {
        AppendClauses(v, member.c_str(), depth, &all);
      } else if (member == "must_not") {
        Json::Value nots(Json::arrayValue);
        AppendClauses(v, member.c_str(), depth, &nots);
        for (Json::Value& n : nots) all.append(Node("not", std::move(n)));
      } else if (member == "should") {
        AppendClauses(v, member.c_str(), depth, &any);
      } else if (member != "minimum_should_match" && member != "boost") {
        throw RequestError(kParsing, "bool does not take \"" + member + "\"");
      }
    }
    if (!any.empty()) all.append(Combine("or", std::move(any)));
    if (all.empty()) return Node("all", true);
    return Combine("and", std::move(all));
  }
  throw RequestError(kParsing, "unknown query [" + kind +
                                   "]: the gateway reads query_string, bool, prefix and match_all");
}

int64_t PageNumber(const Json::Value& root, const char* member, int64_t fallback) {
  const Json::Value& v = root[member];
  if (v.isNull()) return fallback;
  if (!v.isIntegral() || v.asLargestInt() < 0) {
    throw RequestError(kParsing, std::string("\"") + member + "\" must be a number of 0 or more");
  }
  return v.asLargestInt();
}

}  // namespace

Json::Value TranslateQuery(const QueryNode& node, const std::vector<std::string>& fields) {
  switch (node.kind) {
    case QueryNode::kAnd:
    case QueryNode::kOr: {
      Json::Value parts(Json::arrayValue);
      for (const QueryNode& c : node.children) parts.append(TranslateQuery(c, fields));
      return Node(node.kind == QueryNode::kAnd ? "and" : "or", std::move(parts));
    }
    case QueryNode::kNot:
      return Node("not", TranslateQuery(node.children.front(), fields));
    case QueryNode::kRange: {
      const Field& f = FindField(node.field);
      if (f.kind != FieldKind::kNumber && f.kind != FieldKind::kDate) {
        throw RequestError(kBadQuery, "field " + node.field + " takes no range");
      }
      return Range(f, node.low, node.low_included, node.high, node.high_included);
    }
    case QueryNode::kTerm:
    case QueryNode::kPhrase:
      return Leaf(node, fields);
  }
  return Json::Value();
}

bool ParseUtcTime(const std::string& text, int64_t* seconds) {
  const char* p = text.c_str();
  if (!text.empty() && text.find_first_not_of("0123456789") == std::string::npos &&
      text.size() <= 12) {
    *seconds = std::strtoll(p, nullptr, 10);
    return true;
  }
  struct tm tm;
  std::memset(&tm, 0, sizeof tm);
  const char* rest = ::strptime(p, "%Y-%m-%d", &tm);
  if (rest == nullptr || rest - p != 10) return false;
  if (*rest == 'T' || *rest == ' ') {
    const char* t = ::strptime(rest + 1, "%H:%M:%S", &tm);
    if (t == nullptr || t - rest != 9) return false;
    rest = t;
    if (*rest == '.') {
      ++rest;
      if (!std::isdigit(static_cast<unsigned char>(*rest))) return false;
      while (std::isdigit(static_cast<unsigned char>(*rest))) ++rest;
    }
  }
  if (*rest == 'Z') {
    ++rest;
  } else if (std::strcmp(rest, "+00:00") == 0) {
    rest += 6;
  }
  if (*rest != '\0') return false;
  *seconds = ::timegm(&tm);
  return true;
}

std::vector<std::string> ReadIndexList(const std::string& part) {
  std::vector<std::string> ids;
  if (part == "_all" || part == "*") return ids;
  const std::string prefix = platform::ComposeIndexID("");
  size_t start = 0;
  for (;;) {
    const size_t comma = part.find(',', start);
    std::string id = part.substr(start, comma == std::string::npos ? comma : comma - start);
    if (id.size() <= prefix.size() || id.compare(0, prefix.size(), prefix) != 0) {
      throw RequestError("index_not_found_exception", "no such index [" + id +
                                                          "]: an index is named " + prefix +
                                                          "SHARE (the share's name), or _all");
    }
    ids.push_back(std::move(id));
    if (comma == std::string::npos) return ids;
    start = comma + 1;
  }
}

SearchRequest ReadSearchBody(const std::string& body) {
  Json::Value root;
  std::string errors;
  Json::CharReaderBuilder builder;
  builder["strictRoot"] = true;
  builder["rejectDupKeys"] = true;
  const std::unique_ptr<Json::CharReader> reader(builder.newCharReader());
  if (!reader->parse(body.data(), body.data() + body.size(), &root, &errors) || !root.isObject()) {
    throw RequestError(kParsing, "the request body is not a JSON object");
  }
  SearchRequest r;
  r.from = PageNumber(root, "from", 0);
  r.size = PageNumber(root, "size", 10);
  if (r.size > kMaxPageSize) {
    throw RequestError("illegal_argument_exception",
                       "size " + std::to_string(r.size) + " is over the page limit of " +
                           std::to_string(kMaxPageSize) + ": ask for fewer and page with from");
  }
  r.query = root.isMember("query") ? ReadJsonQuery(root["query"], 0) : Node("all", true);
  if (r.query.isMember("under")) {
    r.scope = r.query["under"].asString();
  } else if (r.query.isMember("and")) {
    for (const Json::Value& part : r.query["and"]) {
      if (part.isMember("under")) {
        r.scope = part["under"].asString();
        break;
      }
    }
  }
  return r;
}

std::string BuildSearchReply(const Json::Value& engine_data) {
  const Json::Value& total = engine_data["total"];
  std::string out = "{\"hits\":{\"total\":{\"value\":";
  out += std::to_string(total.isIntegral() ? total.asLargestInt() : 0);
  out += ",\"relation\":\"";
  out += engine_data["total_exact"].isBool() && !engine_data["total_exact"].asBool() ? "gte" : "eq";
  out += "\"},\"hits\":[";
  const std::string tail = "]}}";
  bool first = true;
  for (const Json::Value& hit : engine_data["hits"]) {
    const Json::Value& path = hit["path"];
    if (!path.isString()) continue;
    // A name whose bytes are not UTF-8 keeps the engine's encoded form: a JSON text cannot
    // carry the bytes.
    std::string real = DecodeName(path.asString());
    if (!IsValidUtf8(real)) real = path.asString();
    Json::Value source(Json::objectValue);
    source["_source"]["path"]["real"] = real;
    std::string item = JsonToString(source);
    if (out.size() + item.size() + 1 + tail.size() > kMaxReplyBytes) break;
    if (!first) out += ',';
    out += item;
    first = false;
  }
  out += tail;
  return out;
}

std::string BuildErrorBody(const std::string& type, const std::string& reason, int status) {
  Json::Value cause(Json::objectValue);
  cause["type"] = type;
  cause["reason"] = reason;
  Json::Value root(Json::objectValue);
  root["error"] = cause;
  root["error"]["root_cause"].append(cause);
  root["status"] = status;
  return JsonToString(root);
}

}  // namespace searchgw
}  // namespace orvane
