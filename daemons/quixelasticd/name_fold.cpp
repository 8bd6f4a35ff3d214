#include "daemons/quixelasticd/name_fold.hpp"

#include <sqlite3.h>

#include <algorithm>
#include <cctype>
#include <cstdint>
#include <mutex>

#include "daemons/quixelasticd/sqlite_util.hpp"

namespace orvane {
namespace elasticd {

namespace {

// The unicode61 tokenizer with the word index's settings, reached through the full-text
// module of a private in-memory database. A tokenizer instance keeps a buffer of its own, so
// one instance serves every thread under a lock: a name folds in about a microsecond.
class Folder {
 public:
  Folder() {
    db_.Open(":memory:", true, false);
    fts5_api* api = nullptr;
    {
      sqlite3_stmt* st = nullptr;
      if (sqlite3_prepare_v2(db_.get(), "SELECT fts5(?1)", -1, &st, nullptr) != SQLITE_OK) {
        db_.Fail(SQLITE_ERROR, "the full-text module is missing");
      }
      sqlite3_bind_pointer(st, 1, &api, "fts5_api_ptr", nullptr);
      sqlite3_step(st);
      sqlite3_finalize(st);
    }
    void* user = nullptr;
    if (api == nullptr || api->xFindTokenizer(api, "unicode61", &user, &module_) != SQLITE_OK) {
      throw StoreError(SQLITE_ERROR, "SQLite has no unicode61 tokenizer");
    }
    const char* args[] = {"remove_diacritics", "2"};
    if (module_.xCreate(user, args, 2, &tok_) != SQLITE_OK) {
      throw StoreError(SQLITE_ERROR, "cannot create the unicode61 tokenizer");
    }
  }
  ~Folder() {
    if (tok_ != nullptr) module_.xDelete(tok_);
  }

  std::string Fold(const std::string& text) {
    Out out{&text, std::string(), 0};
    out.folded.reserve(text.size());
    std::lock_guard<std::mutex> lock(mu_);
    module_.xTokenize(tok_, &out, FTS5_TOKENIZE_DOCUMENT, text.data(),
                      static_cast<int>(text.size()), &Out::Token);
    out.Keep(text.size());
    return std::move(out.folded);
  }

  std::vector<std::string> Words(const std::string& text) {
    std::vector<std::string> words;
    std::lock_guard<std::mutex> lock(mu_);
    module_.xTokenize(tok_, &words, FTS5_TOKENIZE_DOCUMENT, text.data(),
                      static_cast<int>(text.size()),
                      [](void* ctx, int, const char* token, int n, int, int) {
                        static_cast<std::vector<std::string>*>(ctx)->emplace_back(
                            token, static_cast<size_t>(n));
                        return SQLITE_OK;
                      });
    return words;
  }

 private:
  struct Out {
    const std::string* text;
    std::string folded;
    size_t done;  // bytes of `text` already accounted for

    // What lies between words is kept, ASCII lowered; combining accents that stand alone
    // (a name in decomposed form) are dropped as the tokenizer drops them inside words.
    void Keep(size_t end) {
      for (size_t i = done; i < end; ++i) {
        const unsigned char c = static_cast<unsigned char>((*text)[i]);
        if (i + 1 < end && (c == 0xCC || (c == 0xCD && static_cast<unsigned char>(
                                                           (*text)[i + 1]) < 0xB0))) {
          ++i;
          continue;
        }
        folded += c >= 'A' && c <= 'Z' ? static_cast<char>(c - 'A' + 'a') : static_cast<char>(c);
      }
      done = std::max(done, end);
    }
    static int Token(void* ctx, int, const char* token, int n, int start, int end) {
      Out* out = static_cast<Out*>(ctx);
      out->Keep(static_cast<size_t>(start));
      out->folded.append(token, static_cast<size_t>(n));
      out->done = static_cast<size_t>(end);
      return SQLITE_OK;
    }
  };

  Db db_;
  fts5_tokenizer module_{};
  Fts5Tokenizer* tok_ = nullptr;
  std::mutex mu_;
};

Folder& TheFolder() {
  static Folder folder;
  return folder;
}

}  // namespace

std::string FoldName(const std::string& text) { return TheFolder().Fold(text); }

std::vector<std::string> FoldWords(const std::string& text) { return TheFolder().Words(text); }

std::string NameKey(const std::string& folded) {
  std::string key;
  key.reserve(folded.size());
  for (size_t i = 0; i < folded.size();) {
    const unsigned char c = static_cast<unsigned char>(folded[i]);
    size_t end = i + 1;
    while (end < folded.size() && (static_cast<unsigned char>(folded[end]) & 0xC0) == 0x80) {
      ++end;
    }
    if (std::isalnum(c)) {
      key += static_cast<char>(std::tolower(c));
    } else {
      uint32_t h = 2166136261u;
      for (size_t k = i; k < end; ++k) h = (h ^ static_cast<unsigned char>(folded[k])) * 16777619u;
      key += '9';
      key += static_cast<char>('a' + h % 26);
    }
    i = end;
  }
  return key;
}

std::string GlobLiteral(const std::string& text, bool stars) {
  std::string out;
  out.reserve(text.size());
  for (char c : text) {
    if (c == '?' || c == '[' || (c == '*' && !stars)) {
      out += '[';
      out += c;
      out += ']';
    } else {
      out += c;
    }
  }
  return out;
}

std::string NameGlobCondition(const std::string& glob) {
  size_t bytes = 0;
  size_t chars = 0;
  for (size_t i = 0; i <= glob.size(); ++i) {
    const char c = i < glob.size() ? glob[i] : '*';
    if (c == '*' || c == '?' || c == '[' || c == ']') {
      // A unary plus keeps the condition from being offered to the index.
      if (bytes >= 3 && chars < 3) return "+fts_name.name GLOB ?";
      bytes = chars = 0;
      continue;
    }
    ++bytes;
    if ((static_cast<unsigned char>(c) & 0xC0) != 0x80) ++chars;
  }
  return "fts_name.name GLOB ?";
}

}  // namespace elasticd
}  // namespace orvane
