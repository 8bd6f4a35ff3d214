#include "extract/html.hpp"

#include <libxml/HTMLparser.h>
#include <libxml/xmlreader.h>

#include <algorithm>
#include <cstring>
#include <map>
#include <memory>
#include <set>
#include <vector>

#include "common/util.hpp"
#include "extract/content.hpp"

namespace orvane {
namespace extract {
namespace {

// Package files of a book are small; anything claiming more is not read past this.
constexpr size_t kMaxPackageBytes = 4 * 1024 * 1024;

const char* Chars(const xmlChar* s) { return reinterpret_cast<const char*>(s); }

bool NameIs(const xmlNode* node, const char* name) {
  return node->name != nullptr &&
         xmlStrcasecmp(node->name, reinterpret_cast<const xmlChar*>(name)) == 0;
}

bool NameIn(const xmlNode* node, std::initializer_list<const char*> names) {
  return std::any_of(names.begin(), names.end(), [node](const char* n) { return NameIs(node, n); });
}

// Elements whose text a reader never sees.
bool IsHidden(const xmlNode* node) {
  return NameIn(node, {"script", "style", "template", "noembed", "object", "svg"});
}

// Elements a browser puts on a line of their own: their text must not run into the next word.
bool IsBlock(const xmlNode* node) {
  return NameIn(
      node,
      {"p",          "div",     "br",     "li",      "ul",     "ol",      "h1",         "h2",
       "h3",         "h4",      "h5",     "h6",      "tr",     "td",      "th",         "table",
       "section",    "article", "header", "footer",  "nav",    "aside",   "blockquote", "pre",
       "dt",         "dd",      "dl",     "hr",      "form",   "option",  "address",    "figure",
       "figcaption", "main",    "body",   "caption", "legend", "summary", "details"});
}

std::string Attribute(const xmlNode* node, const char* name) {
  std::unique_ptr<xmlChar, void (*)(void*)> value(
      xmlGetProp(node, reinterpret_cast<const xmlChar*>(name)), xmlFree);
  return value ? Chars(value.get()) : "";
}

std::string NodeText(const xmlNode* node) {
  std::unique_ptr<xmlChar, void (*)(void*)> text(xmlNodeGetContent(node), xmlFree);
  return text ? Chars(text.get()) : "";
}

// Runs of white space become one space: the source's line breaks and indentation are layout.
void AddCollapsed(const char* text, TextSink* sink) {
  std::string out;
  bool space = false;
  for (const char* p = text; *p != '\0'; ++p) {
    const bool is_space = *p == ' ' || *p == '\t' || *p == '\n' || *p == '\r' || *p == '\f';
    if (is_space) {
      space = true;
      continue;
    }
    if (space && !out.empty()) out += ' ';
    space = false;
    out += *p;
  }
  if (space && !out.empty()) out += ' ';
  if (out.empty()) return;
  // Space before the text separates it from the word before, unless a line ended there.
  if (text[0] != '\0' && std::strchr(" \t\n\r\f", text[0]) != nullptr && !sink->at_line_start()) {
    out.insert(0, 1, ' ');
  }
  sink->Add(out);
}

void SetFirst(Json::Value& fields, const char* key, const std::string& value) {
  if (!fields.isMember(key)) SetText(fields, key, value);
}

void ReadMeta(const xmlNode* node, Json::Value& fields) {
  const std::string name = ToLower(Trim(Attribute(node, "name")));
  const std::string content = Attribute(node, "content");
  if (name == "author") SetFirst(fields, "QUIXMDAuthors", content);
  if (name == "keywords") SetFirst(fields, "QUIXMDKeywords", content);
  if (name == "description") SetFirst(fields, "QUIXMDDescription", content);
}

// The tree is walked without recursion: a page of a million nested tags costs no stack.
void WalkHtml(xmlNode* root, TextSink* sink, Json::Value& fields) {
  xmlNode* node = root;
  while (node != nullptr) {
    bool descend = true;
    if (node->type == XML_ELEMENT_NODE) {
      if (NameIs(node, "title")) {
        SetFirst(fields, "QUIXMDTitle", NodeText(node));
        descend = false;
      } else if (NameIs(node, "meta")) {
        ReadMeta(node, fields);
      } else if (IsHidden(node)) {
        descend = false;
      }
      if (IsBlock(node)) sink->Break();
    } else if ((node->type == XML_TEXT_NODE || node->type == XML_CDATA_SECTION_NODE) &&
               node->content != nullptr) {
      AddCollapsed(Chars(node->content), sink);
      if (sink->full()) return;
    }
    if (descend && node->type == XML_ELEMENT_NODE && node->children != nullptr) {
      node = node->children;
      continue;
    }
    while (node != nullptr && node != root && node->next == nullptr) {
      node = node->parent;
      if (node != nullptr && node->type == XML_ELEMENT_NODE && IsBlock(node)) sink->Break();
    }
    node = node == nullptr || node == root ? nullptr : node->next;
  }
}

// The text of `xml`'s text nodes and comments, a line each, then its vocabulary: each element
// and attribute name and attribute value once, so that a search for a name a file uses, or a
// value it sets, finds it. No network, no entities expanded, no DTD loaded.
void XmlToText(const std::string& xml, TextSink* sink) {
  // Once asked for, the document is the caller's to free, after the reader that built it.
  std::unique_ptr<xmlDoc, void (*)(xmlDocPtr)> doc(nullptr, xmlFreeDoc);
  std::unique_ptr<xmlTextReader, void (*)(xmlTextReaderPtr)> reader(
      xmlReaderForMemory(
          xml.data(), static_cast<int>(xml.size()), nullptr, nullptr,
          XML_PARSE_NONET | XML_PARSE_NOERROR | XML_PARSE_NOWARNING | XML_PARSE_RECOVER),
      xmlFreeTextReader);
  if (!reader) return;
  std::vector<std::string> vocabulary;
  std::set<std::string> seen;
  size_t vocabulary_bytes = 0;
  auto remember = [&](const xmlChar* word) {
    if (word == nullptr || vocabulary_bytes >= kMaxTextBytes) return;
    const std::string w = Trim(Chars(word));
    if (w.empty() || !seen.insert(w).second) return;
    vocabulary_bytes += w.size() + 1;
    vocabulary.push_back(w);
  };
  while (!sink->full() && xmlTextReaderRead(reader.get()) == 1) {
    const int type = xmlTextReaderNodeType(reader.get());
    if (type == XML_READER_TYPE_DOCUMENT_TYPE) {
      // The document type's public and system identifiers name what the file is.
      if (!doc) doc.reset(xmlTextReaderCurrentDoc(reader.get()));
      if (const xmlDtd* dtd = xmlGetIntSubset(doc.get())) {
        remember(dtd->name);
        if (dtd->ExternalID != nullptr) remember(reinterpret_cast<const xmlChar*>("PUBLIC"));
        remember(dtd->ExternalID);
        if (dtd->ExternalID == nullptr && dtd->SystemID != nullptr) {
          remember(reinterpret_cast<const xmlChar*>("SYSTEM"));
        }
        remember(dtd->SystemID);
      }
      continue;
    }
    if (type == XML_READER_TYPE_ELEMENT) {
      remember(xmlTextReaderConstLocalName(reader.get()));
      while (xmlTextReaderMoveToNextAttribute(reader.get()) == 1) {
        remember(xmlTextReaderConstLocalName(reader.get()));
        remember(xmlTextReaderConstValue(reader.get()));
      }
      continue;
    }
    if (type != XML_READER_TYPE_TEXT && type != XML_READER_TYPE_CDATA &&
        type != XML_READER_TYPE_COMMENT) {
      continue;
    }
    const xmlChar* value = xmlTextReaderConstValue(reader.get());
    if (value == nullptr) continue;
    AddCollapsed(Trim(Chars(value)).c_str(), sink);
    sink->Break();
  }
  for (const std::string& w : vocabulary) {
    sink->Add(w);
    sink->Break();
  }
}

void SetBody(TextSink& sink, Json::Value& fields) {
  const std::string text = sink.Take();
  if (text.find_first_not_of(" \n") != std::string::npos) fields["QUIXMDTextContent"] = Trim(text);
}

// ---- EPUB

std::string PercentDecoded(const std::string& s) {
  std::string out;
  for (size_t i = 0; i < s.size(); ++i) {
    if (s[i] == '%' && i + 2 < s.size() && isxdigit(static_cast<unsigned char>(s[i + 1])) &&
        isxdigit(static_cast<unsigned char>(s[i + 2]))) {
      out += static_cast<char>(std::stoi(s.substr(i + 1, 2), nullptr, 16));
      i += 2;
    } else {
      out += s[i];
    }
  }
  return out;
}

// `href` (relative to the folder of `base`) as a member name: "." and ".." resolved, any
// "#fragment" dropped.
std::string ResolveHref(const std::string& base, const std::string& href) {
  const std::string target = PercentDecoded(href.substr(0, href.find('#')));
  const size_t slash = base.rfind('/');
  const std::string joined = target.empty() || target[0] == '/' || slash == std::string::npos
                                 ? target
                                 : base.substr(0, slash + 1) + target;
  std::vector<std::string> parts;
  size_t start = 0;
  while (start <= joined.size()) {
    const size_t end = std::min(joined.find('/', start), joined.size());
    const std::string part = joined.substr(start, end - start);
    if (part == "..") {
      if (!parts.empty()) parts.pop_back();
    } else if (!part.empty() && part != ".") {
      parts.push_back(part);
    }
    start = end + 1;
  }
  std::string out;
  for (const std::string& p : parts) out += (out.empty() ? "" : "/") + p;
  return out;
}

struct Package {
  std::vector<std::string> spine;  // member names in reading order
  std::string title, creator, language;
};

// The package document: its metadata and the spine's items as member names.
Package ReadPackage(const std::string& opf_name, const std::string& opf) {
  Package package;
  std::unique_ptr<xmlTextReader, void (*)(xmlTextReaderPtr)> reader(
      xmlReaderForMemory(opf.data(), static_cast<int>(opf.size()), nullptr, nullptr,
                         XML_PARSE_NONET | XML_PARSE_NOERROR | XML_PARSE_NOWARNING),
      xmlFreeTextReader);
  if (!reader) return package;
  std::map<std::string, std::string> manifest;  // id -> href
  std::vector<std::string> idrefs;
  std::string* meta = nullptr;
  while (xmlTextReaderRead(reader.get()) == 1) {
    const int type = xmlTextReaderNodeType(reader.get());
    const std::string local = Chars(xmlTextReaderConstLocalName(reader.get()));
    auto attr = [&reader](const char* name) {
      std::unique_ptr<xmlChar, void (*)(void*)> v(
          xmlTextReaderGetAttribute(reader.get(), reinterpret_cast<const xmlChar*>(name)), xmlFree);
      return v ? std::string(Chars(v.get())) : std::string();
    };
    if (type == XML_READER_TYPE_ELEMENT) {
      meta = nullptr;
      if (local == "title" && package.title.empty()) meta = &package.title;
      if (local == "creator") meta = &package.creator;
      if (local == "language" && package.language.empty()) meta = &package.language;
      if (meta != nullptr && !meta->empty()) *meta += ", ";  // a second creator
      if (local == "item") manifest[attr("id")] = attr("href");
      if (local == "itemref") idrefs.push_back(attr("idref"));
    } else if (type == XML_READER_TYPE_END_ELEMENT) {
      meta = nullptr;
    } else if (meta != nullptr && (type == XML_READER_TYPE_TEXT || type == XML_READER_TYPE_CDATA)) {
      *meta += Chars(xmlTextReaderConstValue(reader.get()));
    }
  }
  for (const std::string& id : idrefs) {
    auto it = manifest.find(id);
    if (it != manifest.end()) package.spine.push_back(ResolveHref(opf_name, it->second));
  }
  return package;
}

// The package document's name, as the container file gives it.
std::string RootFile(const std::string& container) {
  std::unique_ptr<xmlTextReader, void (*)(xmlTextReaderPtr)> reader(
      xmlReaderForMemory(container.data(), static_cast<int>(container.size()), nullptr, nullptr,
                         XML_PARSE_NONET | XML_PARSE_NOERROR | XML_PARSE_NOWARNING),
      xmlFreeTextReader);
  while (reader && xmlTextReaderRead(reader.get()) == 1) {
    if (xmlTextReaderNodeType(reader.get()) != XML_READER_TYPE_ELEMENT ||
        std::strcmp(Chars(xmlTextReaderConstLocalName(reader.get())), "rootfile") != 0) {
      continue;
    }
    std::unique_ptr<xmlChar, void (*)(void*)> path(
        xmlTextReaderGetAttribute(reader.get(), reinterpret_cast<const xmlChar*>("full-path")),
        xmlFree);
    if (path) return ResolveHref("", Chars(path.get()));
  }
  return "";
}

bool IsChapterName(const std::string& name) {
  const std::string ext = GetFileExtension(name, true);
  return ext == "xhtml" || ext == "html" || ext == "htm";
}

}  // namespace

void HtmlToText(const std::string& html, const char* encoding, TextSink* sink,
                Json::Value& fields) {
  const size_t size = std::min(html.size(), kMaxMarkupBytes);
  std::unique_ptr<xmlDoc, void (*)(xmlDocPtr)> doc(
      htmlReadMemory(
          html.data(), static_cast<int>(size), nullptr, encoding,
          HTML_PARSE_RECOVER | HTML_PARSE_NONET | HTML_PARSE_NOERROR | HTML_PARSE_NOWARNING),
      xmlFreeDoc);
  if (!doc) return;
  WalkHtml(xmlDocGetRootElement(doc.get()), sink, fields);
}

void ExtractHtml(const OpenedFile& file, Json::Value& fields) {
  TextSink sink(kMaxTextBytes);
  HtmlToText(ReadPrefix(file, kMaxMarkupBytes), nullptr, &sink, fields);
  SetBody(sink, fields);
}

void ExtractXml(const OpenedFile& file, Json::Value& fields) {
  const std::string xml = ReadPrefix(file, kMaxMarkupBytes);
  TextSink sink(kMaxTextBytes);
  // XHTML written as XML is a page all the same: its scripts are not text, its title is a title.
  if (ToLower(xml.substr(0, 4096)).find("<html") != std::string::npos) {
    HtmlToText(xml, nullptr, &sink, fields);
  } else {
    XmlToText(xml, &sink);
  }
  SetBody(sink, fields);
}

void ExtractEpub(const OpenedFile& file, Json::Value& fields) {
  // First the small package files, then the chapters, each turned into text as it is read so
  // that only one chapter's markup is held at a time.
  std::map<std::string, std::string> package_files;
  ForEachZipMember(
      file, kMaxPackageBytes,
      [](const std::string& name) {
        return name == "META-INF/container.xml" || GetFileExtension(name, true) == "opf";
      },
      [&](const std::string& name, const std::string& data) {
        package_files[name] = data;
        return true;
      });
  std::string opf_name;
  if (package_files.count("META-INF/container.xml") != 0) {
    opf_name = RootFile(package_files["META-INF/container.xml"]);
  }
  if (package_files.count(opf_name) == 0) {
    opf_name.clear();
    for (const auto& [name, data] : package_files) {
      if (GetFileExtension(name, true) == "opf") opf_name = name;
    }
  }
  if (opf_name.empty()) Fail("a book without a package document");
  const Package package = ReadPackage(opf_name, package_files[opf_name]);
  SetText(fields, "QUIXMDTitle", package.title);
  SetText(fields, "QUIXMDAuthors", package.creator);
  SetText(fields, "QUIXMDLanguages", package.language);

  // A book whose spine names nothing that is there is read in its archive's order.
  const std::set<std::string> in_spine(package.spine.begin(), package.spine.end());
  std::map<std::string, std::string> chapters;
  std::vector<std::string> order;
  size_t total = 0;
  ForEachZipMember(
      file, kMaxMarkupBytes,
      [&](const std::string& name) {
        return in_spine.count(name) != 0 || (in_spine.empty() && IsChapterName(name));
      },
      [&](const std::string& name, const std::string& data) {
        TextSink sink(kMaxTextBytes - total);
        Json::Value ignored;
        HtmlToText(data, nullptr, &sink, ignored);
        chapters[name] = sink.Take();
        order.push_back(name);
        total += chapters[name].size();
        return total < kMaxTextBytes;
      });
  if (!in_spine.empty()) {
    order.clear();
    for (const std::string& name : package.spine) {
      if (chapters.count(name) != 0) order.push_back(name);
    }
  }
  TextSink sink(kMaxTextBytes);
  for (const std::string& name : order) {
    sink.Add(chapters[name]);
    sink.Break();
  }
  SetBody(sink, fields);
}

}  // namespace extract
}  // namespace orvane
