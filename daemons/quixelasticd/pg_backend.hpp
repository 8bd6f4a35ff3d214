// The indexes of this file server kept in a PostgreSQL database that several servers share
// (PgStore), behind the engine's store interface. Each index remembers the folder the registry
// gives it, whose share decides who may see its files.
// Thread-safe; the stores it opens follow the Store interface's rules.
#ifndef ORVANE_DAEMONS_QUIXELASTICD_PG_BACKEND_HPP_
#define ORVANE_DAEMONS_QUIXELASTICD_PG_BACKEND_HPP_

#include <memory>
#include <string>

#include "daemons/quixelasticd/store_api.hpp"

namespace orvane {
namespace elasticd {

// `conninfo`: a libpq connection string; `server`: this file server's name in the database.
// Throws StoreError when the database cannot be prepared (unreachable, no rights).
std::shared_ptr<StoreBackend> PgBackend(const std::string& conninfo, const std::string& server);

}  // namespace elasticd
}  // namespace orvane

#endif  // ORVANE_DAEMONS_QUIXELASTICD_PG_BACKEND_HPP_
