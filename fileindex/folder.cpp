#include "fileindex/folder.hpp"

#include "common/env.hpp"
#include "common/error.hpp"
#include "common/json_util.hpp"
#include "common/sdk/share.hpp"
#include "fileindex/queue_mgr.hpp"
#include "fileindex/status_mgr.hpp"
#include "fileindex/util.hpp"

namespace orvane {
namespace fileindex {
namespace {

constexpr char kAll[] = "all";

}  // namespace

Folder::Folder(const Json::Value& obj) {
  GetJsonValue(path_, obj, "path", true);
  GetJsonValue(name_, obj, "name", true);
  GetJsonValue(document_, obj, "document", true);
  GetJsonValue(audio_, obj, "audio", true);
  GetJsonValue(video_, obj, "video", true);
  GetJsonValue(photo_, obj, "photo", true);
  GetJsonValue(owner_, obj, "owner", false);
  GetJsonValue(group_, obj, "group", false);
  GetJsonValue(privileged_, obj, "privileged", false);
  GetJsonValue(paused_, obj, "paused", false);
  GetJsonValue(volume_to_be_clean_, obj, "volume_to_be_clean", false);
  Validate();
}

Folder::Folder(const std::string& path, const std::string& name, const std::string& owner,
               const std::string& /*group*/, bool document, bool audio, bool video, bool photo,
               bool privileged, bool paused)
    : path_(path),
      name_(name),
      owner_(owner),
      document_(document),
      audio_(audio),
      video_(video),
      photo_(photo),
      privileged_(privileged),
      paused_(paused) {
  Validate();
}

Folder::~Folder() = default;

void Folder::Validate() const {
  ORVANE_THROW_IF(kAll == group_, kErrInvalidParam, "\"all\" is reserved group name");
}

Json::Value Folder::GetData() const {
  Json::Value data(Json::objectValue);
  data["path"] = path_;
  data["name"] = name_;
  data["document"] = document_;
  data["audio"] = audio_;
  data["video"] = video_;
  data["photo"] = photo_;
  data["paused"] = paused_;
  data["owner"] = owner_;
  data["group"] = group_;
  data["privileged"] = privileged_;
  data["volume_to_be_clean"] = volume_to_be_clean_;
  return data;
}

Json::Value Folder::GetIndexCfg() const {
  Json::Value cfg(Json::objectValue);
  cfg["document"] = document_;
  cfg["audio"] = audio_;
  cfg["video"] = video_;
  cfg["photo"] = photo_;
  return cfg;
}

std::string Folder::GetShare() const {
  if (share_.empty()) share_ = GetShareNameByPath(path_);
  return share_;
}

void Folder::SetShare(const std::string& new_share) {
  // The share to look for is the third argument, its replacement the second.
  path_ = ReplacePathShare(path_, new_share, GetShare());
  share_ = new_share;
}

void Folder::SetPath(const std::string& path) {
  path_ = path;
  share_.clear();
  full_path_.clear();
}

std::string Folder::GetFullPath() const {
  if (full_path_.empty()) full_path_ = fileindex::GetFullPath(path_);
  return full_path_;
}

bool Folder::IsIndexing() const {
  sdk::SDKShare share(GetShare());
  QueueMgr queue(share.GetQueuePath());
  return queue.IsFullPathProcessing(GetFullPath());
}

void Folder::GetStatus(Json::Value& out) const {
  StatusMgr status;
  if (!CanPathBeIndexed(path_)) {
    out["text"] = "error";
    out["desc"] = "invalid_path";
    return;
  }
  if (status.GetShareStatus(GetShare()) & kShareStatusNeedReindex) {
    out["text"] = "need_reindex";
    return;
  }
  if (!IsIndexing()) {
    out["text"] = "finished";
    return;
  }
  const long long resume_time = status.GetPauseInfo();
  if (resume_time != 0 && static_cast<long long>(Env::Current()->Now()) >= resume_time) {
    out["text"] = "processing";
  } else {
    out["text"] = "paused";
  }
}

// The parameter keeps the spelling that log readers search for.
Json::Value Folder::GetDataWithAdditional(const Json::Value& addiitionals) const {
  Json::Value result = GetData();
  ORVANE_THROW_IF(!addiitionals.isArray(), kErrInvalidParam, JsonToString(addiitionals));
  for (const Json::Value& it : addiitionals) {
    ORVANE_THROW_IF(!it.isString(), kErrInvalidParam, JsonToString(it));
    ORVANE_THROW_IF("status" != it.asString(), kErrInvalidParam,
                    "Unknown additioal: " + it.asString());
    GetStatus(result["additional"]["status"]);
  }
  return result;
}

}  // namespace fileindex
}  // namespace orvane
