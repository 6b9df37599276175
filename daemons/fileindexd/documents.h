// The documents of a share, as this daemon makes and reads them: those of the library, each with
// the stamp of its file.
#ifndef DAEMONS_FILEINDEXD_DOCUMENTS_H_
#define DAEMONS_FILEINDEXD_DOCUMENTS_H_

#include <json/value.h>

#include <cstdint>
#include <functional>
#include <optional>
#include <string>
#include <vector>

#include "daemons/common/entry_digest.h"
#include "daemons/fileindexd/stamp.h"

namespace vexlo::fileindexd {

struct IndexedPath {
  std::string path;
  std::optional<Stamp> stamp;
};

// `id` is the index's everywhere. Those that send throw Error 913 and what the engine answers, as
// SendRequestImpl() does, and 916 for a reply without a list.

// The document of the path, when there is one.
std::optional<IndexedPath> FindDocument(const std::string& id, const std::string& path);

// Up to `count` documents below `folder`, those behind the path `after` ("" for the first ones), in
// the order of their paths as bytes.
std::vector<IndexedPath> ListBelow(const std::string& id, const std::string& folder,
                                   const std::string& after, unsigned count);

// The same of documents that stand directly in the folder.
std::vector<IndexedPath> ListIn(const std::string& id, const std::string& folder,
                                const std::string& after, unsigned count);

// What stands directly in each folder, as the index has it.
struct IndexedFolder {
  std::string path;  // With "/" behind it.
  daemon::FolderDigest digest;
};
struct FolderPage {
  uint64_t seed = 0;  // Of the hashes.
  std::vector<IndexedFolder> folders;
};

// Up to `count` of the folders at and below `folder` with documents in them, those behind the path
// `after` ("" for the first ones), in the order of their paths, with "/" behind them, as bytes.
FolderPage ListFolders(const std::string& id, const std::string& folder, const std::string& after,
                       unsigned count);

// The request that puts what the path holds now in the place of its document; the one that removes
// the document when nothing is there any more. A file whose content cannot be read is indexed by
// what the file system tells. Throws Error 914 when that cannot be told either.
Json::Value MakePut(const std::string& id, const std::string& path, bool content);

// Whether MakePut() found nothing there.
bool IsDelete(const Json::Value& item);

// Whether it lacks what stands in the file because nobody was there to read it.
bool IsUnread(const Json::Value& item);

// Paths of documents that were put so, up to `count` of those behind the path `after`.
std::vector<std::string> ListUnread(const std::string& id, const std::string& after,
                                    unsigned count);

// Whether somebody is there to read contents.
bool CanReadContents();

// The request that updates what can be told without reading the content; `stamp` goes with it.
Json::Value MakeAttributes(const std::string& id, const std::string& path, const Stamp& stamp);

// The stamp that the path would get now; none when nothing is there. Throws Error 502 when that
// cannot be told.
std::optional<Stamp> StampOfPath(const std::string& path, bool content);

// Whether nothing is at the path, for certain.
bool IsGone(const std::string& path);

// Tells one run of the engine from the next; "" while it does not run.
std::string EngineRun();

// A failure of one request of a list.
struct FailedItem {
  size_t at;
  int code;
  std::string reason;
};

// Sends the requests as one; those that failed. Throws as above for the list as a whole.
std::vector<FailedItem> SendList(Json::Value requests);

// The request that gives the document at `path_old` the path `path`, and what follows from it.
Json::Value MakeMove(const std::string& id, const std::string& path, const std::string& path_old);

// Gives all documents below the folder `path_old` the same place below `path`; neither folder lies
// in the other. Nothing of what a document says besides changes. Returns when the engine has
// answered, and commits nothing. `check` is called before each request and may throw, as sending
// may: some documents have moved then, and the rest moves when it is called again. `failed` is told
// of each document that the engine does not move.
void MoveBelow(const std::string& id, const std::string& path, const std::string& path_old,
               const std::function<void()>& check,
               const std::function<void(const std::string& path, const FailedItem& item)>& failed);

}  // namespace vexlo::fileindexd

#endif  // DAEMONS_FILEINDEXD_DOCUMENTS_H_
