// The documents of a share's index: one for each of its files and folders, known by its full path.
//
// Every operation is a request, or several, that waits while the engine is busy or not ready, for
// hours if need be, and otherwise throws the Error of SendRequestImpl(). What is written is durable
// after IndexCommit().
//
// Not logged are Error 917, which callers meet every day and answer by indexing the path, and what
// the engine answers with codes of its own.
//
// Shares are named, paths are full paths. Any thread may call; a holder of SDKMutex() must not.
#ifndef FILEINDEX_ELASTIC_CONTROL_DOCUMENTS_H_
#define FILEINDEX_ELASTIC_CONTROL_DOCUMENTS_H_

#include <string>
#include <vector>

#include "common/export.h"

namespace vexlo::fileindex::elastic {

// Puts what the extraction library makes of the path in the place of its document, or makes it;
// with `need_meta` the content is read, too. Throws Error 914 when the extraction fails.
VEXLO_EXPORT void IndexUpsert(const std::string& share, const std::string& path, bool need_meta);

// Updates what can be told without reading the content, and leaves the document's other fields.
// Throws Error 917, before anything is extracted, when there is no document; 914 as above.
VEXLO_EXPORT void IndexAttr(const std::string& share, const std::string& path);

// Deletes the path's own document. There may be none.
VEXLO_EXPORT void IndexDel(const std::string& share, const std::string& path);

// Deletes all documents below the path, and not its own.
VEXLO_EXPORT void IndexDelDir(const std::string& share, const std::string& path);

// Appends the paths of documents below `path` to `out`, as many as the engine gives unasked, in its
// order. `id` is an index's id, see GetFileIndexID(), not a share. Throws Error 916 when the reply
// holds no list.
VEXLO_EXPORT void IndexGetByPrefixPath(const std::string& id, const std::string& path,
                                       std::vector<std::string>& out);

// Makes everything that was written durable. When that fails and the share's volume has no room
// left for its index, marks the share for a reindex and throws Error 1003; any other failure is
// thrown as it is. Error 800 in its place when the share has gone.
VEXLO_EXPORT void IndexCommit(const std::string& share);

// Gives the document of `old_path` the path `new_path` and moves all documents below it along,
// 10,000 a request with a commit between two; the last request is the caller's to commit. Mind the
// order of the paths. Throws Error 917 when `old_path` has no document, 916 when a reply holds no
// list. A document that the engine refuses to move is logged and stays.
//
// An engine that refuses 10,000 of them keeps this from ending, and so does a `new_path` below
// `old_path`; each full request is logged, with its number.
VEXLO_EXPORT void IndexRename(const std::string& share, const std::string& new_path,
                              const std::string& old_path);

}  // namespace vexlo::fileindex::elastic

#endif  // FILEINDEX_ELASTIC_CONTROL_DOCUMENTS_H_
