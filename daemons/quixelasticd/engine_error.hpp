// The result codes the daemon answers with, and the exception that carries one from deep inside
// a command up to the reply. Plain values; copyable.
#ifndef ORVANE_DAEMONS_QUIXELASTICD_ENGINE_ERROR_HPP_
#define ORVANE_DAEMONS_QUIXELASTICD_ENGINE_ERROR_HPP_

#include <stdexcept>
#include <string>

namespace orvane {
namespace elasticd {

enum ResultCode : int {
  kCodeMalformed = 100,         // not a JSON object, wrong member shapes
  kCodeUnknownCommand = 101,
  kCodeInvalidParam = 102,      // a member is missing or has the wrong type or value
  kCodePermissionDenied = 103,  // the caller may not run this command
  kCodeTooLarge = 104,          // the frame is longer than the daemon accepts
  kCodeIndexNotFound = 601,
  kCodeIndexExists = 602,
  kCodeDocNotFound = 603,
  kCodeDocInvalid = 604,        // a required field is missing or a value has the wrong type
  kCodeStorage = 605,           // the store could not be read or written (disk full, I/O)
  kCodeIndexPaused = 606,
  kCodeIndexOpening = 607,
  kCodeIndexRecovering = 608,
  kCodeIndexDamaged = 609,      // set aside; needs a rebuild (delete and create)
  kCodeIndexMoving = 610,
  kCodeOutOfMemory = 1400,
  kCodeOverloaded = 1401,        // too many requests or connections (of this user, or of all)
  kCodeSearchTooLong = 1402,     // a search ran past its time budget and was stopped
  kCodeCallerGone = 1403,        // the client hung up while its search ran; never sent
};

class EngineError : public std::runtime_error {
 public:
  EngineError(int code, const std::string& msg) : std::runtime_error(msg), code(code) {}
  int code;
};

}  // namespace elasticd
}  // namespace orvane

#endif  // ORVANE_DAEMONS_QUIXELASTICD_ENGINE_ERROR_HPP_
