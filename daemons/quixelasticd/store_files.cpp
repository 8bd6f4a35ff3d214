#include "daemons/quixelasticd/store_files.hpp"

#include <fcntl.h>
#include <syslog.h>
#include <unistd.h>

#include <cerrno>

#include "common/error.hpp"
#include "common/log.hpp"
#include "common/util.hpp"
#include "daemons/quixelasticd/engine_error.hpp"
#include "daemons/quixelasticd/store.hpp"

namespace orvane {
namespace elasticd {

const std::vector<std::string> kStoreFiles = {"", "-wal", "-shm"};

void RemoveStoreDir(const std::string& dir) {
  const platform::SafeDir parent = OpenStoreDir(Dirname(dir), false);
  if (parent.valid()) parent.RemoveDir(Basename(dir));
}

void MoveStoreFiles(const std::string& from_dir, const std::string& to_dir) {
  const platform::SafeDir from = OpenStoreDir(from_dir, false);
  const platform::SafeDir to = OpenStoreDir(to_dir, true);
  if (!from.valid()) throw EngineError(kCodeStorage, "no store in " + from_dir);
  for (const std::string& suffix : kStoreFiles) {
    const std::string name = IndexStore::kDbFile + suffix;
    const std::string from_file = from_dir + "/" + name;
    const std::string to_file = to_dir + "/" + name;
    if (!from.Exists(name)) continue;
    if (from.RenameTo(name, to, name) == 0) continue;
    if (errno != EXDEV) {
      ORVANE_LOG(LOG_ERR, "rename %s to %s failed [err: %m]", from_file.c_str(), to_file.c_str());
      throw EngineError(kCodeStorage, "cannot move " + from_file);
    }
    UniqueFd in;
    UniqueFd out;
    try {
      in = from.OpenFile(name, O_RDONLY);
      out = to.OpenFile(name, O_WRONLY | O_CREAT | O_TRUNC);
    } catch (const Error& e) {
      throw EngineError(kCodeStorage, e.message);
    }
    if (!in.valid() || !out.valid()) {
      throw EngineError(kCodeStorage, "cannot copy " + from_file + " to " + to_file);
    }
    char buf[64 * 1024];
    for (;;) {
      const ssize_t n = ::read(in.get(), buf, sizeof(buf));
      if (n < 0 && errno == EINTR) continue;
      if (n < 0) throw EngineError(kCodeStorage, "cannot read " + from_file);
      if (n == 0) break;
      for (ssize_t done = 0; done < n;) {
        const ssize_t w = ::write(out.get(), buf + done, static_cast<size_t>(n - done));
        if (w < 0 && errno == EINTR) continue;
        if (w <= 0) throw EngineError(kCodeStorage, "cannot copy " + from_file + " to " + to_file);
        done += w;
      }
    }
    if (::fsync(out.get()) != 0) throw EngineError(kCodeStorage, "cannot sync " + to_file);
    from.Unlink(name);
  }
  to.Sync();
  RemoveStoreDir(from_dir);
}

namespace {

class SqliteStores : public StoreBackend {
 public:
  bool Exists(const std::string& dir, const std::string&) override {
    return IndexStore::ExistsIn(dir);
  }
  std::shared_ptr<Store> Create(const std::string& dir, const std::string& id,
                                const Json::Value& mappings, const Json::Value& settings,
                                const Json::Value& event_handler) override {
    return IndexStore::Create(dir, id, mappings, settings, event_handler);
  }
  std::shared_ptr<Store> Open(const std::string& dir, const std::string&) override {
    return IndexStore::Open(dir);
  }
  void Remove(const std::string& dir, const std::string&) override {
    try {
      const platform::SafeDir folder = OpenStoreDir(dir, false);
      if (folder.valid()) {
        for (const std::string& suffix : kStoreFiles) folder.Unlink(IndexStore::kDbFile + suffix);
      }
      RemoveStoreDir(dir);
    } catch (const StoreError& err) {
      // The index is forgotten either way; what stands in its folder's place is not touched.
      ORVANE_LOG(LOG_ERR, "%s", err.what());
    }
  }
  void Move(const std::string& from_dir, const std::string& to_dir,
            const std::string&) override {
    MoveStoreFiles(from_dir, to_dir);
  }
  void SetAside(const std::string& dir, const std::string&, const std::string& stamp) override {
    try {
      const platform::SafeDir folder = OpenStoreDir(dir, false);
      for (const std::string& suffix : kStoreFiles) {
        const std::string name = IndexStore::kDbFile + suffix;
        if (folder.valid() && folder.Exists(name)) folder.Rename(name, name + stamp);
      }
    } catch (const StoreError& err) {
      ORVANE_LOG(LOG_ERR, "%s", err.what());
    }
  }
};

}  // namespace

std::shared_ptr<StoreBackend> SqliteBackend() { return std::make_shared<SqliteStores>(); }

}  // namespace elasticd
}  // namespace orvane
