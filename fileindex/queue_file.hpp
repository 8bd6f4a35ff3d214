// QueueFileReader reads a queue file line by line through its own buffer, with one bounded
// line length so a corrupt file cannot make a line cost unbounded memory. Owns its descriptor;
// not thread-safe.
#ifndef ORVANE_FILEINDEX_QUEUE_FILE_HPP_
#define ORVANE_FILEINDEX_QUEUE_FILE_HPP_

#include <memory>
#include <string>

#include "common/fd.hpp"

namespace orvane {
namespace fileindex {

class QueueFileReader {
 public:
  // Opens `path` for reading; test the object for success (errno tells why not).
  explicit QueueFileReader(const std::string& path);
  QueueFileReader(const QueueFileReader&) = delete;
  QueueFileReader& operator=(const QueueFileReader&) = delete;

  explicit operator bool() const { return fd_.valid(); }

  // The next line without its "\n" (the last one may lack it). A line longer than
  // `max_length` is cut there and the rest of it skipped; the caller sees it by its size being
  // over the limit (one byte more is kept). False at end of file or on a read error.
  bool ReadLine(std::string* line, size_t max_length);

 private:
  bool Fill();

  UniqueFd fd_;
  std::unique_ptr<char[]> buf_;
  size_t begin_ = 0;
  size_t end_ = 0;
  bool eof_ = false;
};

}  // namespace fileindex
}  // namespace orvane

#endif  // ORVANE_FILEINDEX_QUEUE_FILE_HPP_
