// Case-insensitive comparison of UTF-8 texts, as the administration listing sorts names and
// paths. Code points are compared after simple lower-case mapping (the C.UTF-8 locale's
// tables); a byte that does not start a valid sequence is compared as itself, after every
// valid code point. Stateless; safe from any thread.
#ifndef ORVANE_PLATFORM_UNICODE_HPP_
#define ORVANE_PLATFORM_UNICODE_HPP_

namespace orvane {
namespace platform {

// Negative, 0 or positive as `a` sorts before, with or after `b`.
int QLIBCUnicodeUTF8StrCaseCmp(const char* a, const char* b);

}  // namespace platform
}  // namespace orvane

#endif  // ORVANE_PLATFORM_UNICODE_HPP_
