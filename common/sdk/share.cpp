#include "common/sdk/share.hpp"

#include <cstdio>
#include <cstring>

#include "common/error.hpp"
#include "platform/fileidx.hpp"
#include "platform/platform_error.hpp"
#include "platform/quota.hpp"
#include "platform/share.hpp"

namespace orvane {
namespace sdk {

using namespace orvane::platform;  // NOLINT: the platform calls read as the platform names them

namespace {

constexpr uint64_t kRequiredFreeBytes = 104857600;  // 100 MiB
constexpr int kShareListSize = 1024;

int AcceptEveryShare(const QUIXSHARE*) { return 0; }

// The platform's share look-up straight into the record's owner. Adopted without the deleter's
// lock: the caller holds it.
template <typename Owner>
int QUIXShareGet(const char* name, Owner* owner) {
  QUIXSHARE* share = nullptr;
  const int rc = platform::QUIXShareGet(name, &share);
  owner->reset(share);
  return rc;
}

}  // namespace

void SDKShare::ShareFree::operator()(QUIXSHARE* share) const {
  LockMutex lock(SDKMutex());
  QUIXShareFree(share);
}

SDKShare::SDKShare(const std::string& share_name) : share_name_(share_name) {
  LockMutex lock(SDKMutex());
  ORVANE_THROW_IF(0 > QUIXShareGet(share_name.c_str(), &share_info_) || !share_info_, kErrShareGet,
                  share_name);
}

SDKShare::~SDKShare() = default;

bool SDKShare::CanBeIndexed() const {
  LockMutex lock(SDKMutex());
  int is_encrypted = 0;
  int is_readonly = 0;
  ORVANE_THROW_IF(0 > QLIBShareIsEncryptedGet(share_info_.get(), &is_encrypted), kErrSystem,
                  "QLIBShareis_encryptedGet failed, share=" + share_name_);
  ORVANE_THROW_IF(0 > QLIBShareIsReadOnlyGet(share_info_.get(), &is_readonly), kErrSystem,
                  "QLIBShareis_readonlyGet failed, share=" + share_name_);
  return !is_encrypted && !is_readonly;
}

bool SDKShare::IsEncryption() const {
  LockMutex lock(SDKMutex());
  int is_encryption = 0;
  ORVANE_THROW_IF(0 > QLIBShareIsEncryptionGet(share_info_.get(), &is_encryption), kErrSystem,
                  "QLIBShareIsEncryptionGet failed, share=" + share_name_);
  return is_encryption == 1;
}

bool SDKShare::IsEnableRecycleBin() const {
  LockMutex lock(SDKMutex());
  int is_enabled = 0;
  ORVANE_THROW_IF(0 > QLIBShareRecycleStatusGet(share_info_.get(), &is_enabled), kErrSystem,
                  "QLIBShareRecycleStatusGet failed, share=" + share_name_);
  return is_enabled == 1;
}

bool SDKShare::IsHideUnReadable() const {
  int is_hidden = 0;
  if (0 > QLIBShareHideUnreadableGet(share_info_.get(), &is_hidden)) return false;
  return is_hidden == 1;
}

bool SDKShare::IsSpaceEnough() const {
  LockMutex lock(SDKMutex());
  if (0 == QUIXQuotaIsEnough(0, share_info_->szPath, kRequiredFreeBytes)) {
    const uint32_t err = QLIBCErrGet();
    // Only a definite "full" blocks indexing; anything the platform cannot tell does not.
    if (err == kQErrQuotaExceeded || err == kQErrVolumeFull) return false;
  }
  return true;
}

int SDKShare::GetFTPPrivilege() const { return share_info_->fFTPPrivilege; }

int SDKShare::GetPrivilege(const std::string& user) const {
  auto it = privileges_.find(user);
  if (it != privileges_.end()) return it->second;
  const int32_t privilege = QUIXShareUserPrivCalc(user.c_str(), share_info_.get());
  privileges_[user] = privilege;
  return privilege;
}

const std::string& SDKShare::GetQueuePath() const {
  if (queue_path_.empty()) {
    LockMutex lock(SDKMutex());
    char path[4096] = {};
    ORVANE_THROW_IF(0 > FILEIDXQueuePathCompose(share_info_->szPath, path, sizeof(path)),
                    kErrSystem, "FILEIDXQueuePathCompose failed, share=" + share_name_);
    queue_path_ = path;
  }
  return queue_path_;
}

const std::string& SDKShare::GetDBPath() const {
  if (db_path_.empty()) {
    LockMutex lock(SDKMutex());
    char path[4096] = {};
    ORVANE_THROW_IF(0 > FILEIDXDBPathCompose(share_info_->szPath, path, sizeof(path)),
                    kErrSystem, "FILEIDXDBPathCompose failed, share=" + share_name_);
    db_path_ = path;
  }
  return db_path_;
}

const std::string& SDKShare::GetDBName() const {
  if (db_name_.empty()) {
    LockMutex lock(SDKMutex());
    char path[1024] = {};
    ORVANE_THROW_IF(0 > FILEIDXGetIndexID(share_info_->szName, path, sizeof(path)), kErrSystem,
                    "FILEIDXGetIndexID failed, share=" + share_name_);
    db_name_ = path;
  }
  return db_name_;
}

std::string SDKShare::GetName() const { return share_info_->szName; }

std::string SDKShare::GetPath() const { return share_info_->szPath; }

std::set<std::string> SDKShare::Enum() {
  std::unique_ptr<QLIBSZLIST, void (*)(PSZLIST)> owned(nullptr, QLIBCSzListFree);
  PSZLIST share_list = nullptr;
  ORVANE_THROW_IF_TEXT("nullptr == (share_list = QLIBCSzListAlloc(BUFSIZ))",
                       nullptr == (share_list = QLIBCSzListAlloc(kShareListSize)), kErrShareEnum,
                       "QLIBCSzListAlloc failed");
  owned.reset(share_list);
  auto& enum_func = AcceptEveryShare;
  ORVANE_THROW_IF(0 > QLIBShareEnum(&share_list, &enum_func), kErrShareEnum,
                  "QLIBShareEnum failed");
  std::set<std::string> names;
  for (int i = 0; i < QLIBCSzListCount(share_list); ++i) names.insert(QLIBCSzListGet(share_list, i));
  return names;
}

}  // namespace sdk
}  // namespace orvane
