// The field schema of one index, read from the "mappings" given at its creation: per field its
// value type, analyzer, whether it is required, stored and part of the catch-all text, and its
// preprocessing. Also derives from a document the values the store indexes.
// Immutable after Parse(); safe to share between threads.
#ifndef ORVANE_DAEMONS_QUIXELASTICD_SCHEMA_HPP_
#define ORVANE_DAEMONS_QUIXELASTICD_SCHEMA_HPP_

#include <json/json.h>

#include <cstdint>
#include <map>
#include <string>
#include <vector>

namespace orvane {
namespace elasticd {

// Field names of the file vocabulary that the people's search reads as columns.
extern const char kFieldFSName[];
extern const char kFieldParent[];
extern const char kFieldExtension[];
extern const char kFieldSize[];
extern const char kFieldMtime[];
extern const char kFieldIsDir[];
extern const char kFieldCtime[];
extern const char kFieldCrtime[];
extern const char kFieldOwner[];
extern const char kFieldGroup[];
extern const char kFieldDisplayName[];
extern const char kFieldSearchName[];
extern const char kFieldKind[];

enum class FieldType { kString, kText, kInt, kDouble, kBool };

struct FieldSpec {
  FieldType type = FieldType::kString;
  std::string analyzer = "quixstandard";
  bool required = false;
  bool stored = true;
  bool all = true;
  bool tolower = false;
  bool ngram = false;
  bool list_ancestor = false;
};

// What the store keeps in columns and full-text tables for one document.
struct DerivedDoc {
  std::string path;      // the property_id field
  std::string parent;
  std::string name;
  std::string ext;
  std::string ancestor;  // the list_ancestor field: scope queries match it and its ancestors
  std::string name_text; // the n-grammed fields, preprocessed
  std::string all_text;  // the catch-all text
  int64_t size = 0;
  int64_t mtime = 0;
  bool is_dir = false;
};

class Schema {
 public:
  // Reads a mappings object; throws EngineError(kCodeInvalidParam) naming what is wrong.
  static Schema Parse(const Json::Value& mappings);

  const std::string& property_id() const { return property_id_; }
  // The field whose value is expanded into its ancestors ("" when none).
  const std::string& ancestor_field() const { return ancestor_field_; }
  // The attributes of `field`: its own, or the default for fields the mappings do not list.
  const FieldSpec& Field(const std::string& field) const;
  bool IsListed(const std::string& field) const { return fields_.count(field) != 0; }

  // Checks a whole document: required fields present, values of the declared type.
  // Throws EngineError(kCodeDocInvalid).
  void Validate(const Json::Value& doc) const;
  DerivedDoc Derive(const Json::Value& doc) const;
  // The stored fields of `doc` among `names` (all stored fields when `names` is empty).
  Json::Value Load(const Json::Value& doc, const std::vector<std::string>& names) const;

 private:
  std::string property_id_;
  FieldSpec default_;
  std::map<std::string, FieldSpec> fields_;
  std::vector<std::string> ngram_fields_;
  std::vector<std::string> all_fields_order_;
  std::string ancestor_field_;
};

// Text of a scalar or array value for the full-text tables: strings as they are, numbers in
// decimal, arrays joined with spaces; objects and null give "".
std::string ValueText(const Json::Value& v);

// ASCII lower-casing that leaves UTF-8 sequences untouched.
std::string AsciiLower(std::string s);

}  // namespace elasticd
}  // namespace orvane

#endif  // ORVANE_DAEMONS_QUIXELASTICD_SCHEMA_HPP_
