// The files of one index's store on disk (the database and its WAL and shared-memory files),
// and moving or removing them as a whole. Folders are reached without following links.
// Stateless; callers serialise work on one index by its lock.
#ifndef ORVANE_DAEMONS_QUIXELASTICD_STORE_FILES_HPP_
#define ORVANE_DAEMONS_QUIXELASTICD_STORE_FILES_HPP_

#include <string>
#include <vector>

namespace orvane {
namespace elasticd {

// Suffixes of the store's files after IndexStore::kDbFile.
extern const std::vector<std::string> kStoreFiles;

// Removes the index folder `dir` once it is empty, through its parent's verified descriptor.
void RemoveStoreDir(const std::string& dir);

// Moves the store files of one folder to another: a rename when both are on one file system,
// else a synced copy followed by removal of the originals. Both folders are reached without
// following links, and the files are moved through their descriptors.
void MoveStoreFiles(const std::string& from_dir, const std::string& to_dir);

}  // namespace elasticd
}  // namespace orvane

#endif  // ORVANE_DAEMONS_QUIXELASTICD_STORE_FILES_HPP_
