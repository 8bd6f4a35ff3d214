// The exception that carries a result code (common/wire.hpp) from deep inside a command up to
// the reply. A plain value; copyable.
#ifndef ORVANE_DAEMONS_QUIXELASTICD_ENGINE_ERROR_HPP_
#define ORVANE_DAEMONS_QUIXELASTICD_ENGINE_ERROR_HPP_

#include <stdexcept>
#include <string>

#include "common/wire.hpp"

namespace orvane {
namespace elasticd {

class EngineError : public std::runtime_error {
 public:
  EngineError(int code, const std::string& msg) : std::runtime_error(msg), code(code) {}
  int code;
};

}  // namespace elasticd
}  // namespace orvane

#endif  // ORVANE_DAEMONS_QUIXELASTICD_ENGINE_ERROR_HPP_
