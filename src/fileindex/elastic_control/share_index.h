// The index that each indexed share has in the search engine.
//
// Each Share... operation is one request. It waits while the engine is busy or not ready, for hours
// if need be, and throws the Error of SendRequestImpl(). Any thread may call; a holder of
// SDKMutex() must not.
#ifndef FILEINDEX_ELASTIC_CONTROL_SHARE_INDEX_H_
#define FILEINDEX_ELASTIC_CONTROL_SHARE_INDEX_H_

#include <json/value.h>

#include <string>

#include "common/export.h"

// The indexes of shares in the search engine, and their documents.
namespace vexlo::fileindex::elastic {

// "fileindex_" and the share's name as it stands: spaces and capitals are kept.
VEXLO_EXPORT std::string GetFileIndexID(const std::string& share);

// What a new index is made with: its settings, an empty object; the mappings of schema.h; and the
// library that the engine loads to handle the index's events.
VEXLO_EXPORT Json::Value GetFileIndexSettings();
VEXLO_EXPORT Json::Value GetFileIndexMappings();
VEXLO_EXPORT Json::Value GetFileIndexEventHandler();

// Makes the index in the share's database directory. Throws Error 800 for an unknown share, 502
// when its directory cannot be told; nothing is sent then.
VEXLO_EXPORT void ShareIndexCreate(const std::string& share);
// Remove the index with all that is in it; close it until it is resumed, when all of it is in its
// directory and may be moved; open it again. They go by the name alone: the
// share may be gone by now.
VEXLO_EXPORT void ShareIndexDelete(const std::string& share);
VEXLO_EXPORT void ShareIndexPause(const std::string& share);
VEXLO_EXPORT void ShareIndexResume(const std::string& share);

// Gives the index of `old_share` the id of `new_share` and the directory `new_path`. No document is
// touched.
VEXLO_EXPORT void ShareIndexRename(const std::string& old_share, const std::string& new_share,
                                   const std::string& new_path);

// Tells the engine that the index's directory is `new_path` from now on.
VEXLO_EXPORT void ShareIndexMigrate(const std::string& share, const std::string& new_path);

}  // namespace vexlo::fileindex::elastic

#endif  // FILEINDEX_ELASTIC_CONTROL_SHARE_INDEX_H_
