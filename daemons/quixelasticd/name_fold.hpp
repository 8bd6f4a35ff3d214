// FoldName: the form of a file name that the trigram name index holds and that name patterns
// are compared in: letters and digits folded exactly as the word index folds words (lower
// case, diacritics removed, by SQLite's own unicode61 tokenizer), every other character kept,
// ASCII letters lowered. Thread-safe; the tokenizer lives for the whole process.
#ifndef ORVANE_DAEMONS_QUIXELASTICD_NAME_FOLD_HPP_
#define ORVANE_DAEMONS_QUIXELASTICD_NAME_FOLD_HPP_

#include <string>
#include <vector>

namespace orvane {
namespace elasticd {

// `text` is UTF-8 (names in their written form). Throws StoreError when SQLite's tokenizer
// cannot be had, which only a broken SQLite build causes.
std::string FoldName(const std::string& text);

// A folded name (or a literal run of a name pattern) as the PostgreSQL store's trigram index
// keys it: ASCII letters and digits as they are, every other character as '9' and a letter
// chosen by its bytes. That index keeps only letters and digits in its trigrams; keyed so, it
// sees every character. Characters may share a key: the folded name itself is checked after.
std::string NameKey(const std::string& folded);

// The words of `text` (UTF-8) in order, folded as the word index folds them.
std::vector<std::string> FoldWords(const std::string& text);

// `text` as a GLOB pattern that matches it literally ('?' and '[' in brackets, and '*' too
// unless `stars` keeps them as wildcards).
std::string GlobLiteral(const std::string& text, bool stars = false);

// The condition that matches the trigram index's names against the GLOB pattern `glob` (bound
// to its one '?'): looked up by trigrams, or, for a pattern the index would answer wrongly (a
// literal run of three bytes or more but fewer than three characters finds nothing), by
// scanning the names.
std::string NameGlobCondition(const std::string& glob);

}  // namespace elasticd
}  // namespace orvane

#endif  // ORVANE_DAEMONS_QUIXELASTICD_NAME_FOLD_HPP_
