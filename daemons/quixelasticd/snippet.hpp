// The snippet function of searches: a window of a few words of the catch-all text around the
// matches, the matches marked. Its work is bounded whatever the document holds (a word repeated
// hundreds of thousands of times costs one pass over the text, never a pass per match).
// Registered once per connection; SQLite calls it on that connection's thread.
#ifndef ORVANE_DAEMONS_QUIXELASTICD_SNIPPET_HPP_
#define ORVANE_DAEMONS_QUIXELASTICD_SNIPPET_HPP_

#include <sqlite3.h>

namespace orvane {
namespace elasticd {

// The SQL name: bounded_snippet(fts_table, open, close, ellipsis, words).
constexpr const char kSnippetFunction[] = "bounded_snippet";
// Matches looked at to place the window; later ones are only marked when they fall in it.
constexpr int kSnippetCandidates = 256;

// Adds the function to the full-text tables of `db`; throws StoreError.
void RegisterSnippetFunction(sqlite3* db);

}  // namespace elasticd
}  // namespace orvane

#endif  // ORVANE_DAEMONS_QUIXELASTICD_SNIPPET_HPP_
