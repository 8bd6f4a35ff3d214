// Reads a web-facing daemon's command line one option at a time, an option's value being the
// argument after it. Holds pointers into argv; one thread.
#ifndef ORVANE_DAEMONS_HTTP_FLAGS_HPP_
#define ORVANE_DAEMONS_HTTP_FLAGS_HPP_

#include <cerrno>
#include <cstdlib>
#include <string>

namespace orvane {
namespace httpd {

class FlagArgs {
 public:
  FlagArgs(int argc, char** argv) : argc_(argc), argv_(argv) {}

  // The next option; nullptr after the last.
  const char* Next() { return i_ + 1 < argc_ ? argv_[++i_] : nullptr; }

  // Takes the option's value; false when there is none.
  bool Text(std::string* out) {
    if (i_ + 1 >= argc_) return false;
    *out = argv_[++i_];
    return true;
  }

  // Takes the option's value as a whole decimal number in [min, max]; false otherwise.
  template <typename T>
  bool Number(long long min, long long max, T* out) {
    if (i_ + 1 >= argc_) return false;
    const char* text = argv_[i_ + 1];
    char* end = nullptr;
    errno = 0;
    const long long v = std::strtoll(text, &end, 10);
    if (errno != 0 || end == text || *end != '\0' || v < min || v > max) return false;
    *out = static_cast<T>(v);
    ++i_;
    return true;
  }

 private:
  int argc_;
  char** argv_;
  int i_ = 0;
};

}  // namespace httpd
}  // namespace orvane

#endif  // ORVANE_DAEMONS_HTTP_FLAGS_HPP_
