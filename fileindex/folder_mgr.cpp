#include "fileindex/folder_mgr.hpp"

#include <sys/stat.h>

#include <algorithm>

#include "common/error.hpp"
#include "common/json_util.hpp"
#include "common/root.hpp"
#include "common/sdk/credentials.hpp"
#include "common/util.hpp"
#include "fileindex/util.hpp"
#include "platform/unicode.hpp"

namespace orvane {
namespace fileindex {

const char kFileIndexFoldersCfgPath[] = "/var/packages/Orvane/etc/fileindex.folders";
const char kFolderCfgLockPath[] = "/tmp/orvane_cfg_folder.lock";

FolderMgr::FolderMgr() {
  const std::string path = RootedPath(kFileIndexFoldersCfgPath);
  // Under the installation root, and named as the file it stands for so that a failure logs
  // the condition as it reads.
  const char* const kFileIndexFoldersCfgPath = path.c_str();
  JsonValue folders(Json::arrayValue);
  ORVANE_THROW_IF(
      IsFileExist(kFileIndexFoldersCfgPath) && !folders.fromFile(kFileIndexFoldersCfgPath),
      kErrLoadConfig, "Cannot load json: " + path);
  // A root of another type is as unusable as a broken file; it is refused the same way and the
  // file is left for the administrator to look at.
  ORVANE_THROW_IF(!folders.isArray(), kErrLoadConfig, "Cannot load json: " + path);
  folders_.reserve(folders.size());
  for (const Json::Value& element : folders) folders_.push_back(std::make_shared<Folder>(element));
}

FolderMgr::~FolderMgr() = default;

void FolderMgr::Save() const {
  const std::string path = RootedPath(kFileIndexFoldersCfgPath);
  // Under the installation root, and named as the file it stands for so that a failure logs
  // the condition as it reads.
  const char* const kFileIndexFoldersCfgPath = path.c_str();
  JsonValue folders(Json::arrayValue);
  for (const auto& folder : folders_) folders.append(folder->GetData());
  sdk::SDKCredentials root("root");
  ORVANE_THROW_IF(!folders.toFile(kFileIndexFoldersCfgPath), kErrSaveConfig, path);
  ORVANE_THROW_IF(-1 == chmod(kFileIndexFoldersCfgPath, 0644), kErrSystem, path);
}

void FolderMgr::Get(std::shared_ptr<Folder>& out, const std::string& path) const {
  auto it = std::find_if(folders_.begin(), folders_.end(),
                         [&path](const auto& folder) { return folder->GetPath() == path; });
  ORVANE_THROW_IF(it == folders_.end(), kErrFolderNotFound, path);
  out = *it;
}

bool FolderMgr::HasFolder(const std::string& path) const {
  return std::any_of(folders_.begin(), folders_.end(),
                     [&path](const auto& folder) { return folder->GetPath() == path; });
}

const FolderMgr::FullPathIndex& FolderMgr::Index() const {
  if (!by_full_path_) {
    auto index = std::make_unique<FullPathIndex>();
    index->reserve(folders_.size());
    // emplace keeps the first position of a full path: the earlier folder wins among equals.
    for (size_t i = 0; i < folders_.size(); ++i) index->emplace(folders_[i]->GetFullPath(), i);
    by_full_path_ = std::move(index);
  }
  return *by_full_path_;
}

std::shared_ptr<Folder> FolderMgr::GetMostSuitableCfg(const std::string& full_path) const {
  // A folder F covers the path P when F + "/" begins P + "/", i.e. F is P cut just before one
  // of its slashes (or P itself). Trying those cuts from the longest down finds the deepest
  // folder in a few hash look-ups instead of a pass over the whole list.
  const FullPathIndex& index = Index();
  if (index.empty()) return nullptr;
  size_t end = full_path.size();
  while (end > 0) {
    auto it = index.find(full_path.substr(0, end));
    if (it != index.end()) return folders_[it->second];
    end = full_path.rfind('/', end - 1);
    if (end == std::string::npos) break;
  }
  return nullptr;
}

bool FolderMgr::IsFullPathIndexed(const std::string& full_path) const {
  return GetMostSuitableCfg(full_path) != nullptr;
}

bool FolderMgr::IsFullPathHasOwnCfg(const std::string& full_path) const {
  return Index().count(full_path) != 0;
}

bool FolderMgr::IsFullPathNeedMeta(const std::string& full_path) const {
  std::shared_ptr<Folder> cfg = GetMostSuitableCfg(full_path);
  if (!cfg) return false;
  switch (GetFileTypeByFullPath(full_path)) {
    case kDocument:
      return cfg->IsDocument();
    case kAudio:
      return cfg->IsAudio();
    case kVideo:
      return cfg->IsVideo();
    case kPhoto:
      return cfg->IsPhoto();
    default:
      return true;
  }
}

bool FolderMgr::IsShareIndexed(const std::string& share) const {
  return std::any_of(folders_.begin(), folders_.end(),
                     [&share](const auto& folder) { return folder->GetShare() == share; });
}

std::set<std::string> FolderMgr::GetIndexedShares() const {
  std::set<std::string> shares;
  for (const auto& folder : folders_) shares.insert(folder->GetShare());
  return shares;
}

std::set<std::string> FolderMgr::GetGroups() const {
  std::set<std::string> groups;
  for (const auto& folder : folders_) {
    if (!folder->GetGroup().empty()) groups.insert(folder->GetGroup());
  }
  return groups;
}

void FolderMgr::Upsert(std::shared_ptr<Folder>& diff, std::shared_ptr<Folder> folder) {
  diff = DiffCfg(folder, GetMostSuitableCfg(folder->GetFullPath()));
  const std::string path = folder->GetPath();
  folders_.erase(std::remove_if(folders_.begin(), folders_.end(),
                                [&path](const auto& f) { return f->GetPath() == path; }),
                 folders_.end());
  folders_.push_back(std::move(folder));
  Changed();
}

void FolderMgr::Delete(std::shared_ptr<Folder>& diff, const std::string& path) {
  const std::string full = fileindex::GetFullPath(path);
  std::shared_ptr<Folder> before = GetMostSuitableCfg(full);
  // Callers check HasFolder first; a path that governs nothing has nothing to diff against.
  ORVANE_THROW_IF(!before, kErrFolderNotFound, path);
  folders_.erase(std::remove_if(folders_.begin(), folders_.end(),
                                [&path](const auto& f) { return f->GetPath() == path; }),
                 folders_.end());
  Changed();
  std::shared_ptr<Folder> after = GetMostSuitableCfg(full);
  diff = DiffCfg(before, after);
}

void FolderMgr::DeleteByShare(const std::string& share) {
  folders_.erase(std::remove_if(folders_.begin(), folders_.end(),
                                [&share](const auto& f) { return f->GetShare() == share; }),
                 folders_.end());
  Changed();
}

std::shared_ptr<Folder> FolderMgr::DiffCfg(std::shared_ptr<Folder> now,
                                           std::shared_ptr<Folder> base) {
  if (!base) {
    return std::make_shared<Folder>(now->GetPath(), now->GetName(), "", "", true, true, true, true,
                                    false, false);
  }
  return std::make_shared<Folder>(
      now->GetPath(), now->GetName(), "", "", now->IsDocument() != base->IsDocument(),
      now->IsAudio() != base->IsAudio(), now->IsVideo() != base->IsVideo(),
      now->IsPhoto() != base->IsPhoto(), false, false);
}

void FolderMgr::List(std::vector<std::shared_ptr<Folder>>& out, unsigned int& total,
                     unsigned int offset, unsigned int limit, const std::string& sort_by,
                     const std::string& sort_direction, const std::string& group,
                     const std::string& keyword) const {
  out.clear();
  const bool any_group = group == "all";
  const std::string needle = ToLower(Trim(keyword));
  for (const auto& folder : folders_) {
    if (!any_group && folder->GetGroup() != group) continue;
    if (!keyword.empty() && ToLower(folder->GetName()).find(needle) == std::string::npos) {
      continue;
    }
    out.push_back(folder);
  }
  total = static_cast<unsigned int>(out.size());

  using Less = bool (*)(const std::shared_ptr<Folder>&, const std::shared_ptr<Folder>&);
  Less less = nullptr;
  if (sort_by == "document") {
    less = [](const auto& a, const auto& b) { return !a->IsDocument() && b->IsDocument(); };
  } else if (sort_by == "audio") {
    less = [](const auto& a, const auto& b) { return !a->IsAudio() && b->IsAudio(); };
  } else if (sort_by == "video") {
    less = [](const auto& a, const auto& b) { return !a->IsVideo() && b->IsVideo(); };
  } else if (sort_by == "photo") {
    less = [](const auto& a, const auto& b) { return !a->IsPhoto() && b->IsPhoto(); };
  } else if (sort_by == "path") {
    less = [](const auto& a, const auto& b) {
      return platform::QLIBCUnicodeUTF8StrCaseCmp(a->GetPath().c_str(), b->GetPath().c_str()) < 0;
    };
  } else {
    less = [](const auto& a, const auto& b) {
      return platform::QLIBCUnicodeUTF8StrCaseCmp(a->GetName().c_str(), b->GetName().c_str()) < 0;
    };
  }
  std::sort(out.begin(), out.end(), less);
  if (ToLower(sort_direction) == "desc") std::reverse(out.begin(), out.end());

  const size_t begin = std::min<size_t>(offset, out.size());
  const size_t end = std::min<size_t>(out.size(), begin + limit);
  out = std::vector<std::shared_ptr<Folder>>(out.begin() + begin, out.begin() + end);
}

}  // namespace fileindex
}  // namespace orvane
