#include "platform/fileidx.hpp"

#include <string>

#include "platform/internal.hpp"

namespace orvane {
namespace platform {
namespace {

int Compose(const char* share_path, const char* suffix, char* buf, size_t size) {
  if (share_path == nullptr || share_path[0] != '/' || buf == nullptr) {
    return PLATFORM_FAIL(-1, EINVAL, kQErrBadParam);
  }
  std::string path = share_path;
  while (path.size() > 1 && path.back() == '/') path.pop_back();
  if (!CopyOut(path + suffix, buf, size)) return PLATFORM_FAIL(-1, ENAMETOOLONG, kQErrBufferTooSmall);
  return 0;
}

}  // namespace

int FILEIDXQueuePathCompose(const char* share_path, char* buf, size_t size) {
  PLATFORM_FAULT_POINT("FILEIDXQueuePathCompose", nullptr);
  return Compose(share_path, "/@eaDir/@fileindex/queue", buf, size);
}

int FILEIDXDBPathCompose(const char* share_path, char* buf, size_t size) {
  PLATFORM_FAULT_POINT("FILEIDXDBPathCompose", nullptr);
  return Compose(share_path, "/@eaDir/@fileindex/db", buf, size);
}

int FILEIDXGetIndexID(const char* share_name, char* buf, size_t size) {
  PLATFORM_FAULT_POINT("FILEIDXGetIndexID", nullptr);
  if (share_name == nullptr || share_name[0] == '\0' || buf == nullptr) {
    return PLATFORM_FAIL(-1, EINVAL, kQErrBadParam);
  }
  if (!CopyOut(ComposeIndexID(share_name), buf, size)) {
    return PLATFORM_FAIL(-1, ENAMETOOLONG, kQErrBufferTooSmall);
  }
  return 0;
}

std::string ComposeIndexID(const std::string& share_name) { return "fileindex_" + share_name; }

}  // namespace platform
}  // namespace orvane
