#include "daemons/quixelasticd/snippet.hpp"

#include <algorithm>
#include <deque>
#include <string>
#include <vector>

#include "daemons/quixelasticd/sqlite_util.hpp"

namespace orvane {
namespace elasticd {

namespace {

struct Match {
  int phrase;
  int first;  // token position of the phrase's first token
  int last;   // of its last token
};

// The byte ranges of the window's tokens, collected while the text is tokenised.
struct Window {
  int begin = 0;  // token positions [begin, end)
  int end = 0;
  int position = 0;   // of the next token
  bool more = false;  // a token follows the window
  std::vector<std::pair<int, int>> bytes;
};

int CollectToken(void* arg, int flags, const char*, int, int start, int stop) {
  Window& w = *static_cast<Window*>(arg);
  // A colocated token is a synonym at the position of the one before it.
  if ((flags & FTS5_TOKEN_COLOCATED) != 0) return SQLITE_OK;
  const int pos = w.position++;
  if (pos < w.begin) return SQLITE_OK;
  if (pos >= w.end) {
    w.more = true;
    // Stops the tokenizer: the rest of the text is not needed.
    return SQLITE_DONE;
  }
  w.bytes.emplace_back(start, stop);
  return SQLITE_OK;
}

// Where the window starts: among the kept matches, the start that covers the most distinct
// phrases, then the most matches, the earliest on a tie. Quadratic only in the kept matches.
int PlaceWindow(const std::vector<Match>& matches, int words) {
  if (matches.empty()) return 0;
  const size_t n = matches.size();
  int best_start = 0;
  long best_score = -1;
  for (size_t i = 0; i < n; ++i) {
    // A match opens the window a quarter in, so that it is read with some words before it.
    const int start = std::max(0, matches[i].first - words / 4);
    const int end = start + words;
    std::vector<int> phrases;
    long hits = 0;
    for (size_t j = i > 64 ? i - 64 : 0; j < n && matches[j].first < end; ++j) {
      if (matches[j].first < start || matches[j].last >= end) continue;
      ++hits;
      if (std::find(phrases.begin(), phrases.end(), matches[j].phrase) == phrases.end()) {
        phrases.push_back(matches[j].phrase);
      }
    }
    const long score = static_cast<long>(phrases.size()) * 1000000 + hits;
    if (score > best_score) {
      best_score = score;
      best_start = start;
    }
  }
  return best_start;
}

void SnippetFunction(const Fts5ExtensionApi* api, Fts5Context* fts, sqlite3_context* ctx, int argc,
                     sqlite3_value** argv) {
  if (argc != 4) {
    sqlite3_result_error(ctx, "bounded_snippet takes open, close, ellipsis and a word count", -1);
    return;
  }
  auto text_arg = [&](int i) {
    const unsigned char* v = sqlite3_value_text(argv[i]);
    return v == nullptr ? std::string() : std::string(reinterpret_cast<const char*>(v));
  };
  const std::string open = text_arg(0), close = text_arg(1), ellipsis = text_arg(2);
  const int words = std::max(1, std::min(64, sqlite3_value_int(argv[3])));

  // The instance list is built once, in one pass over the position lists, ordered by
  // position. The window is placed among the first matches and the first match of each
  // phrase with the words after it, so that a word repeated a hundred thousand times neither
  // costs a look at each of its matches nor hides a rarer word further on.
  int count = 0;
  int rc = api->xInstCount(fts, &count);
  const int phrases = api->xPhraseCount(fts);
  std::vector<bool> seen(static_cast<size_t>(std::max(phrases, 0)), false);
  std::vector<Match> matches;
  // The last matches left out, which a window opened by a later first match may cover.
  std::deque<Match> skipped;
  int keep_until = -1;
  for (int i = 0; rc == SQLITE_OK && i < count; ++i) {
    int phrase = 0, column = 0, offset = 0;
    rc = api->xInst(fts, i, &phrase, &column, &offset);
    if (rc != SQLITE_OK || column != 0 || phrase < 0 || phrase >= phrases) continue;
    const Match match{phrase, offset, offset + std::max(1, api->xPhraseSize(fts, phrase)) - 1};
    const bool first = !seen[static_cast<size_t>(phrase)];
    seen[static_cast<size_t>(phrase)] = true;
    if (matches.size() < static_cast<size_t>(kSnippetCandidates) || first) {
      keep_until = std::max(keep_until, offset + 64);
      for (const Match& m : skipped) {
        if (m.first >= offset - 16) matches.push_back(m);
      }
      skipped.clear();
    }
    if (offset < keep_until) {
      matches.push_back(match);
    } else {
      skipped.push_back(match);
      if (skipped.size() > 64) skipped.pop_front();
    }
  }
  if (rc != SQLITE_OK) {
    sqlite3_result_error_code(ctx, rc);
    return;
  }
  Window w;
  w.begin = PlaceWindow(matches, words);
  w.end = w.begin + words;
  const char* text = nullptr;
  int text_bytes = 0;
  rc = api->xColumnText(fts, 0, &text, &text_bytes);
  if (rc == SQLITE_OK && text != nullptr)
    rc = api->xTokenize(fts, text, text_bytes, &w, CollectToken);
  if (rc != SQLITE_OK && rc != SQLITE_DONE) {
    sqlite3_result_error_code(ctx, rc);
    return;
  }
  // Every match inside the window is marked, also those left out of the placement.
  std::vector<bool> marked(w.bytes.size(), false);
  for (int i = 0; i < count; ++i) {
    int phrase = 0, column = 0, offset = 0;
    if (api->xInst(fts, i, &phrase, &column, &offset) != SQLITE_OK || column != 0) continue;
    if (offset >= w.end) break;
    const int last = offset + std::max(1, api->xPhraseSize(fts, phrase)) - 1;
    for (int pos = std::max(offset, w.begin);
         pos <= last && pos - w.begin < static_cast<int>(marked.size()); ++pos) {
      marked[static_cast<size_t>(pos - w.begin)] = true;
    }
  }
  std::string out;
  if (w.begin > 0 && !w.bytes.empty()) out += ellipsis;
  for (size_t t = 0; t < w.bytes.size(); ++t) {
    if (t > 0) out.append(text + w.bytes[t - 1].second, text + w.bytes[t].first);
    if (marked[t]) out += open;
    out.append(text + w.bytes[t].first, text + w.bytes[t].second);
    if (marked[t]) out += close;
  }
  if (w.more) out += ellipsis;
  sqlite3_result_text(ctx, out.data(), static_cast<int>(out.size()), SQLITE_TRANSIENT);
}

}  // namespace

void RegisterSnippetFunction(sqlite3* db) {
  fts5_api* api = nullptr;
  sqlite3_stmt* stmt = nullptr;
  int rc = sqlite3_prepare_v2(db, "SELECT fts5(?1)", -1, &stmt, nullptr);
  if (rc == SQLITE_OK) {
    sqlite3_bind_pointer(stmt, 1, &api, "fts5_api_ptr", nullptr);
    sqlite3_step(stmt);
    rc = sqlite3_finalize(stmt);
  }
  if (rc != SQLITE_OK || api == nullptr) {
    throw StoreError(rc == SQLITE_OK ? SQLITE_ERROR : rc, "the full-text module is missing");
  }
  rc = api->xCreateFunction(api, kSnippetFunction, nullptr, SnippetFunction, nullptr);
  if (rc != SQLITE_OK) throw StoreError(rc, std::string("cannot add ") + kSnippetFunction);
}

}  // namespace elasticd
}  // namespace orvane
