// Folder is one indexed folder as an administrator configured it: the path, its display name,
// which kinds of content are indexed, who owns the entry and whether it is paused. Records are
// shared through std::shared_ptr; the share name and full path are cached lazily by the const
// getters, so one record must not be read from two threads at once.
#ifndef ORVANE_FILEINDEX_FOLDER_HPP_
#define ORVANE_FILEINDEX_FOLDER_HPP_

#include <json/json.h>

#include <string>

namespace orvane {
namespace fileindex {

class Folder {
 public:
  // From a stored or requested record: "path", "name" and the four content switches are
  // required, the rest optional (a member of the wrong type keeps its default). Error 120 for a
  // missing or mistyped required member and for the reserved group "all".
  explicit Folder(const Json::Value& obj);
  // The group argument is accepted and not stored: a record made this way has no group.
  Folder(const std::string& path, const std::string& name, const std::string& owner,
         const std::string& group, bool document, bool audio, bool video, bool photo,
         bool privileged, bool paused);
  ~Folder();

  // Error 120 "\"all\" is reserved group name" when the group is "all".
  void Validate() const;

  // The eleven stored members, in the order in which the folder file holds them.
  Json::Value GetData() const;
  // The four content switches, for the index side.
  Json::Value GetIndexCfg() const;
  // GetData() plus the extras named in `additionals` (only "status"), under "additional".
  Json::Value GetDataWithAdditional(const Json::Value& additionals) const;

  // The share holding the folder, and the folder's path on its volume (cached).
  std::string GetShare() const;
  std::string GetFullPath() const;
  // Moves the record to share `new_share`: the path's share component is replaced.
  void SetShare(const std::string& new_share);

  // Whether the share's queue still has work at or below this folder.
  bool IsIndexing() const;
  // Writes "text" (and "desc" for an invalid path) into `out`: "error", "need_reindex",
  // "finished", "processing" or "paused".
  void GetStatus(Json::Value& out) const;

  const std::string& GetPath() const { return path_; }
  const std::string& GetName() const { return name_; }
  const std::string& GetOwner() const { return owner_; }
  const std::string& GetGroup() const { return group_; }
  const std::string& GetVolumeToBeClean() const { return volume_to_be_clean_; }
  bool IsDocument() const { return document_; }
  bool IsAudio() const { return audio_; }
  bool IsVideo() const { return video_; }
  bool IsPhoto() const { return photo_; }
  bool IsPrivileged() const { return privileged_; }
  bool IsPaused() const { return paused_; }

  // A new stored path: the caches are dropped so they follow it.
  void SetPath(const std::string& path);
  void SetPaused(bool paused) { paused_ = paused; }
  void SetVolumeToBeClean(const std::string& volume) { volume_to_be_clean_ = volume; }

 private:
  std::string path_;
  std::string name_;
  std::string owner_;
  std::string group_;
  std::string volume_to_be_clean_;
  bool document_ = false;
  bool audio_ = false;
  bool video_ = false;
  bool photo_ = false;
  bool privileged_ = false;
  bool paused_ = false;
  mutable std::string share_;
  mutable std::string full_path_;
};

}  // namespace fileindex
}  // namespace orvane

#endif  // ORVANE_FILEINDEX_FOLDER_HPP_
