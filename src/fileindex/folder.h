// One indexed folder, as the administrator configured it.
#ifndef FILEINDEX_FOLDER_H_
#define FILEINDEX_FOLDER_H_

#include <json/value.h>

#include <string>

#include "common/export.h"

namespace vexlo::fileindex {

// Which folder is indexed, under which name and group, and which of the four groups of file types
// are indexed there. Folders are told apart by their share path, "/photo/2019".
//
// A record does not change once it stands in a list, except by SetShare(). Share name and full path
// are looked up at the first question and kept; the object has no lock, so before several threads
// share it, GetShare() and GetFullPath() are called once.
class VEXLO_EXPORT Folder {
 public:
  // From an object as GetData() gives it. "path", "name" and the four types are required; the rest
  // may be missing, and is "" or false then, as it is when it does not convert. Throws Error 120 as
  // GetJsonValue() and Validate() do. Nothing is looked up: the share need not exist.
  explicit Folder(const Json::Value& data);

  // For records that say what has changed. `group` is ignored, so that such a record is in none.
  Folder(const std::string& path, const std::string& name, const std::string& owner,
         const std::string& group, bool document, bool audio, bool video, bool photo,
         bool privileged, bool paused);

  // As they stand in the record: the share path, what people call the folder, and whose it is.
  const std::string& GetPath() const { return path_; }
  const std::string& GetName() const { return name_; }
  const std::string& GetOwner() const { return owner_; }
  const std::string& GetGroup() const { return group_; }  // "" for none.
  // Whose index data is still to be removed; kept here for the operations on volumes.
  const std::string& GetVolumeToBeClean() const { return volume_to_be_clean_; }
  // Whether files of the type are indexed with what stands in them.
  bool IsDocument() const { return document_; }
  bool IsAudio() const { return audio_; }
  bool IsVideo() const { return video_; }
  bool IsPhoto() const { return photo_; }
  bool IsPrivileged() const { return privileged_; }
  // Kept and reported; pausing is for the whole service (StatusMgr).
  bool IsPaused() const { return paused_; }

  // The share that holds the folder. Throws Error 120 for a path that does not begin with "/".
  std::string GetShare() const;

  // The folder on its volume, "/volume1/photo/2019". Throws Error 120 as above, 800 when the share
  // is unknown.
  std::string GetFullPath() const;

  // Puts the folder into another share, for a share that was renamed. A full path that was asked
  // for before stays the old one. Throws Error 120 as GetShare() does, and when the path has no
  // such component.
  void SetShare(const std::string& share);

  // The record as it is saved and reported: "path", "name", "document", "audio", "video", "photo",
  // "paused", "owner", "group", "privileged", "volume_to_be_clean".
  Json::Value GetData() const;

  // The four types alone: {"document": bool, "audio": bool, "video": bool, "photo": bool}.
  Json::Value GetIndexCfg() const;

  // Whether events for the folder, or for anything below it, still wait in the share's queue. Reads
  // the queue. Throws as SDKShare and QueueMgr::IsFullPathProcessing() do.
  bool IsIndexing() const;

  // Sets "text" in `out`, which is an object or null: "error" (with "desc": "invalid_path") for a
  // folder that cannot be indexed, else "need_reindex", else "finished" when nothing waits, else
  // "paused" or "processing". Reads the status file. Throws as CanPathBeIndexed(), StatusMgr and
  // IsIndexing() do.
  void GetStatus(Json::Value& out) const;

  // GetData() with what `additional` asks for, an array of names; the one name is "status":
  // {..., "additional": {"status": as GetStatus() says}}. Throws Error 120 for anything else.
  Json::Value GetDataWithAdditional(const Json::Value& additional) const;

  // Throws Error 120 when the group is "all", which in a list of groups means no filter.
  void Validate() const;

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
  mutable std::string share_;      // "" until asked for.
  mutable std::string full_path_;  // The same.
};

}  // namespace vexlo::fileindex

#endif  // FILEINDEX_FOLDER_H_
