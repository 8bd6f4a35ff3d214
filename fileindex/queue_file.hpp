// Both ends of a queue file. QueueFileReader reads it line by line through its own buffer, with
// one bounded line length so a corrupt file cannot make a line cost unbounded memory; it owns its
// descriptor and is not thread-safe. QueueFileAppend is the writers' side.
#ifndef ORVANE_FILEINDEX_QUEUE_FILE_HPP_
#define ORVANE_FILEINDEX_QUEUE_FILE_HPP_

#include <memory>
#include <string>

#include "common/fd.hpp"

namespace orvane {
namespace fileindex {

class QueueFileReader {
 public:
  // Opens `path` for reading without following links (a queue under a share's "@eaDir" is
  // reached component by component, see platform::SafeDir); test the object for success (errno
  // tells why not). Throws Error(kErrUnsafePath) when a planted entry stands in the way.
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

// Appends `lines` (whole lines, each ending in "\n") to the queue at `queue_path` in one write,
// creating the file (0600) and its folders (0700) if missing, never through a link; a planted
// entry is refused with Error(kErrUnsafePath). It holds the queue's lock while writing, and
// checks that the file it locked is still the live queue: the reader may have just renamed it to
// the side file, and a line written there would miss the batch already being read. False (errno
// set) when the queue cannot be opened, locked or written.
bool QueueFileAppend(const std::string& queue_path, const std::string& lines);

}  // namespace fileindex
}  // namespace orvane

#endif  // ORVANE_FILEINDEX_QUEUE_FILE_HPP_
