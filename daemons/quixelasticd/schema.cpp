#include "daemons/quixelasticd/schema.hpp"

#include <algorithm>
#include <cmath>
#include <cstring>

#include "common/json_util.hpp"
#include "daemons/quixelasticd/engine_error.hpp"

namespace orvane {
namespace elasticd {

const char kFieldFSName[] = "QUIXMDFSName";
const char kFieldParent[] = "QUIXMDParent";
const char kFieldExtension[] = "QUIXMDExtension";
const char kFieldSize[] = "QUIXMDFSSize";
const char kFieldMtime[] = "QUIXMDFSContentChangeDate";
const char kFieldIsDir[] = "QUIXMDIsDir";
const char kFieldCtime[] = "QUIXMDAttributeChangeDate";
const char kFieldCrtime[] = "QUIXMDFSCreationDate";
const char kFieldOwner[] = "QUIXMDOwnerUserID";
const char kFieldGroup[] = "QUIXMDOwnerGroupID";
const char kFieldDisplayName[] = "QUIXMDDisplayName";
const char kFieldSearchName[] = "QUIXMDSearchFileName";
const char kFieldKind[] = "QUIXMDKind";

namespace {

[[noreturn]] void Invalid(const std::string& what) {
  throw EngineError(kCodeInvalidParam, "mappings: " + what);
}

void ReadSpec(FieldSpec& field, const std::string& name, const Json::Value& attrs) {
  if (!attrs.isObject()) Invalid("attributes of " + name + " are not an object");
  for (const std::string& key : attrs.getMemberNames()) {
    const Json::Value& v = attrs[key];
    if (key == "type") {
      const std::string t = v.isString() ? v.asString() : "";
      if (t == "string") field.type = FieldType::kString;
      else if (t == "text") field.type = FieldType::kText;
      else if (t == "int") field.type = FieldType::kInt;
      else if (t == "double") field.type = FieldType::kDouble;
      else if (t == "bool") field.type = FieldType::kBool;
      else Invalid("unknown type of " + name + ": " + JsonToString(v));
    } else if (key == "analyzer") {
      const std::string a = v.isString() ? v.asString() : "";
      if (a != "quixstandard" && a != "keyword" && a != "white space" &&
          a != "white space escaped") {
        Invalid("unknown analyzer of " + name + ": " + JsonToString(v));
      }
      field.analyzer = a;
    } else if (key == "required" || key == "stored" || key == "_all") {
      if (!v.isBool()) Invalid(key + " of " + name + " is not a bool");
      (key == "required" ? field.required : key == "stored" ? field.stored : field.all) = v.asBool();
    } else if (key == "preprocess") {
      if (!v.isArray()) Invalid("preprocess of " + name + " is not an array");
      for (const Json::Value& p : v) {
        const std::string step = p.isString() ? p.asString() : "";
        if (step == "tolower") field.tolower = true;
        else if (step == "ngram") field.ngram = true;
        else if (step == "list_ancestor") field.list_ancestor = true;
        else Invalid("unknown preprocess of " + name + ": " + JsonToString(p));
      }
    }
    // Other attributes are the engine's to ignore, so that a newer schema still loads.
  }
}

bool IsTextual(const FieldSpec& field) {
  return field.type == FieldType::kString || field.type == FieldType::kText;
}

bool ScalarOk(const Json::Value& v) { return v.isString() || v.isNumeric() || v.isBool(); }

bool ValueMatches(const FieldSpec& field, const Json::Value& v) {
  switch (field.type) {
    case FieldType::kInt:
      return v.isIntegral() || (v.isDouble() && std::isfinite(v.asDouble()) &&
                                std::floor(v.asDouble()) == v.asDouble() &&
                                std::fabs(v.asDouble()) < 9.2e18);
    case FieldType::kDouble:
      return v.isNumeric();
    case FieldType::kBool:
      return v.isBool() || (v.isIntegral() && (v.asLargestInt() == 0 || v.asLargestInt() == 1));
    case FieldType::kString:
    case FieldType::kText:
      if (ScalarOk(v)) return true;
      if (!v.isArray()) return false;
      for (const Json::Value& e : v) {
        if (!ScalarOk(e)) return false;
      }
      return true;
  }
  return false;
}

std::string StringOf(const Json::Value& doc, const char* field) {
  const Json::Value* v = doc.find(field, field + std::char_traits<char>::length(field));
  return v != nullptr && v->isString() ? v->asString() : std::string();
}

int64_t IntOf(const Json::Value& doc, const char* field) {
  const Json::Value* v = doc.find(field, field + std::char_traits<char>::length(field));
  if (v == nullptr || !v->isNumeric()) return 0;
  if (v->isIntegral()) return v->asLargestInt();
  const double d = v->asDouble();
  return std::isfinite(d) && std::fabs(d) < 9.2e18 ? static_cast<int64_t>(d) : 0;
}

}  // namespace

std::string AsciiLower(std::string s) {
  for (char& c : s) {
    if (c >= 'A' && c <= 'Z') c = static_cast<char>(c - 'A' + 'a');
  }
  return s;
}

std::string ValueText(const Json::Value& v) {
  if (v.isString()) return v.asString();
  if (v.isBool()) return v.asBool() ? "true" : "false";
  if (v.type() == Json::uintValue) return std::to_string(v.asLargestUInt());
  if (v.isIntegral()) return std::to_string(v.asLargestInt());
  if (v.isNumeric()) return JsonToString(v);
  if (v.isArray()) {
    std::string out;
    for (const Json::Value& e : v) {
      const std::string t = ValueText(e);
      if (t.empty()) continue;
      if (!out.empty()) out += ' ';
      out += t;
    }
    return out;
  }
  return std::string();
}

Schema Schema::Parse(const Json::Value& mappings) {
  if (!mappings.isObject()) Invalid("not an object");
  Schema s;
  const Json::Value& pid = mappings["property_id"];
  if (!pid.isString() || pid.asString().empty()) Invalid("property_id is not a non-empty string");
  s.property_id_ = pid.asString();
  if (mappings.isMember("default")) ReadSpec(s.default_, "default", mappings["default"]);
  const Json::Value& props = mappings["properties"];
  if (!props.isNull() && !props.isObject()) Invalid("properties is not an object");
  if (props.isObject()) {
    // Member order of the text is lost by the JSON reader; the catch-all text only needs a
    // stable order, which the sorted names give.
    for (const std::string& name : props.getMemberNames()) {
      FieldSpec field = s.default_;
      ReadSpec(field, name, props[name]);
      s.fields_[name] = field;
      if (field.ngram) s.ngram_fields_.push_back(name);
      if (field.list_ancestor && s.ancestor_field_.empty()) s.ancestor_field_ = name;
    }
  }
  return s;
}

const FieldSpec& Schema::Field(const std::string& field) const {
  auto it = fields_.find(field);
  return it == fields_.end() ? default_ : it->second;
}

void Schema::Validate(const Json::Value& doc) const {
  if (!doc.isObject()) throw EngineError(kCodeDocInvalid, "document is not an object");
  for (const auto& [name, field] : fields_) {
    if (!field.required) continue;
    const Json::Value* v = doc.find(name.data(), name.data() + name.size());
    if (v == nullptr || v->isNull() || (v->isString() && v->asString().empty())) {
      throw EngineError(kCodeDocInvalid, "required field missing: " + name);
    }
  }
  if (default_.required) {
    // A default that makes every field required cannot name them; nothing to check.
  }
  for (auto it = doc.begin(); it != doc.end(); ++it) {
    if (it->isNull()) continue;
    const std::string name = it.name();
    if (!ValueMatches(Field(name), *it)) {
      throw EngineError(kCodeDocInvalid,
                        "field " + name + " has a value of the wrong type: " + JsonToString(*it));
    }
  }
  const Json::Value* id = doc.find(property_id_.data(), property_id_.data() + property_id_.size());
  if (id == nullptr || !id->isString() || id->asString().empty()) {
    throw EngineError(kCodeDocInvalid, "field " + property_id_ + " is not a non-empty string");
  }
}

DerivedDoc Schema::Derive(const Json::Value& doc) const {
  DerivedDoc d;
  d.path = StringOf(doc, property_id_.c_str());
  d.parent = StringOf(doc, kFieldParent);
  d.name = StringOf(doc, kFieldFSName);
  d.ext = AsciiLower(StringOf(doc, kFieldExtension));
  d.size = IntOf(doc, kFieldSize);
  d.mtime = IntOf(doc, kFieldMtime);
  const Json::Value* dir = doc.find(kFieldIsDir, kFieldIsDir + std::strlen(kFieldIsDir));
  d.is_dir = dir != nullptr && ((dir->isBool() && dir->asBool()) ||
                                (dir->isIntegral() && dir->asLargestInt() != 0));
  if (!ancestor_field_.empty()) d.ancestor = StringOf(doc, ancestor_field_.c_str());
  for (const std::string& f : ngram_fields_) {
    const Json::Value* v = doc.find(f.data(), f.data() + f.size());
    if (v == nullptr) continue;
    std::string t = ValueText(*v);
    if (Field(f).tolower) t = AsciiLower(t);
    if (!d.name_text.empty() && !t.empty()) d.name_text += '\n';
    d.name_text += t;
  }
  // Numbers and flags are filtered by range, not searched as words. A value already in the
  // text (the display name repeats the file name) is not indexed twice.
  std::vector<std::string> parts;
  std::vector<std::string> folded;
  for (auto it = doc.begin(); it != doc.end(); ++it) {
    const FieldSpec& field = Field(it.name());
    if (!field.all || !IsTextual(field)) continue;
    std::string t = ValueText(*it);
    if (field.tolower) t = AsciiLower(t);
    std::string low = AsciiLower(t);
    if (t.empty() || std::find(folded.begin(), folded.end(), low) != folded.end()) continue;
    parts.push_back(std::move(t));
    folded.push_back(std::move(low));
  }
  for (const std::string& t : parts) {
    if (!d.all_text.empty()) d.all_text += '\n';
    d.all_text += t;
  }
  return d;
}

Json::Value Schema::Load(const Json::Value& doc, const std::vector<std::string>& names) const {
  Json::Value out(Json::objectValue);
  if (names.empty()) {
    for (auto it = doc.begin(); it != doc.end(); ++it) {
      if (Field(it.name()).stored) out[it.name()] = *it;
    }
    return out;
  }
  for (const std::string& n : names) {
    const Json::Value* v = doc.find(n.data(), n.data() + n.size());
    if (v != nullptr && Field(n).stored) out[n] = *v;
  }
  return out;
}

}  // namespace elasticd
}  // namespace orvane
