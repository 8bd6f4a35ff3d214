// The confinement of the extraction helper: once installed, the process (and every
// program it starts) may read files, map memory, run threads, write to the descriptors it
// already holds and start the converters it runs, and nothing else: no file is opened for
// writing, created, renamed or removed, no socket is made, no other process is traced or
// signalled (its own process groups excepted). Stateless; call once, on the main thread.
#ifndef ORVANE_EXTRACT_SYSCALL_FILTER_HPP_
#define ORVANE_EXTRACT_SYSCALL_FILTER_HPP_

#include <string>

namespace orvane {
namespace extract {

// Drops every capability but reading and searching any file (a root helper still reads every
// share, and can do nothing else a user could not), then installs the filter (no_new_privs too);
// a refused call fails with EPERM (ENOSYS for calls the C library falls back from). False with
// the reason in `*error` when the kernel or the filter library refused; the helper must then
// not go on.
bool ConfineExtractionHelper(std::string* error);

}  // namespace extract
}  // namespace orvane

#endif  // ORVANE_EXTRACT_SYSCALL_FILTER_HPP_
