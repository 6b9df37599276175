// "fileindex index ...": the indexes of shares, and "fileindex doc ...": single documents in them.
#include <json/value.h>

#include <algorithm>
#include <functional>

#include "cli/command.h"
#include "cli/engine.h"
#include "cli/folder_paths.h"
#include "cli/shares.h"
#include "cli/text.h"
#include "common/file.h"
#include "common/json.h"
#include "common/sdk/share.h"
#include "common/string.h"
#include "fileindex/elastic_control/documents.h"
#include "fileindex/elastic_control/share_index.h"
#include "fileindex/util/share_path.h"

namespace vexlo::cli {
namespace {

namespace elastic = fileindex::elastic;

ExitStatus Do(const Console& console, const std::string& done, const std::function<void()>& work) {
  WithEngine(work);
  console.out << ForTerminal(done) << "\n";
  return kDone;
}

ExitStatus CreateIndex(const Arguments& arguments, const Console& console) {
  const std::string& share = arguments.positional[0];
  return Do(console, "created: the index of " + share, [&] { elastic::ShareIndexCreate(share); });
}

ExitStatus DeleteIndex(const Arguments& arguments, const Console& console) {
  const std::string& share = arguments.positional[0];
  return Do(console, "deleted: the index of " + share, [&] { elastic::ShareIndexDelete(share); });
}

ExitStatus PauseIndex(const Arguments& arguments, const Console& console) {
  const std::string& share = arguments.positional[0];
  return Do(console, "paused: the index of " + share, [&] { elastic::ShareIndexPause(share); });
}

ExitStatus ResumeIndex(const Arguments& arguments, const Console& console) {
  const std::string& share = arguments.positional[0];
  return Do(console, "resumed: the index of " + share, [&] { elastic::ShareIndexResume(share); });
}

// The folder that was named, or the one where the platform keeps the index of `share`.
std::string IndexFolder(const Arguments& arguments, size_t at, const std::string& share) {
  return arguments.positional.size() > at ? AbsolutePath(arguments.positional[at])
                                          : sdk::SDKShare(share).GetDBPath();
}

ExitStatus RenameIndex(const Arguments& arguments, const Console& console) {
  const std::string& from = arguments.positional[0];
  const std::string& to = arguments.positional[1];
  return Do(console, "renamed: the index of " + from + " is that of " + to,
            [&] { elastic::ShareIndexRename(from, to, IndexFolder(arguments, 2, to)); });
}

ExitStatus MigrateIndex(const Arguments& arguments, const Console& console) {
  const std::string& share = arguments.positional[0];
  return Do(console, "moved: the index of " + share,
            [&] { elastic::ShareIndexMigrate(share, IndexFolder(arguments, 1, share)); });
}

ExitStatus ListIndexes(const Arguments& arguments, const Console& console) {
  Json::Value request;
  request["command"] = "index_list";
  const Json::Value list = AskEngine(request);
  for (const Json::Value& index : list) {
    if (arguments.Has("--json")) {
      console.out << JsonToString(index) << "\n";
    } else {
      console.out << ForTerminal(index["id"].asString() + "  " + index["state"].asString() + "  " +
                                 index["path"].asString())
                  << "\n";
    }
  }
  return list.empty() ? kNothingFound : kDone;
}

// The path of a document, by a path of the file system or below the share: "/photo/2019". A
// symbolic link on the way is followed, one that is named itself is not: it may have a document
// that is to go.
std::string DocumentPath(const std::string& path) {
  std::string absolute = AbsolutePath(path);
  const std::string folder = absolute.substr(0, std::max<size_t>(absolute.rfind('/'), 1));
  const std::string followed = IndexedPath(folder);
  if (std::string in_share = followed + "/" + Basename(absolute);
      followed != folder && !SharePathOf(in_share).empty()) {
    return in_share;
  }
  if (IsFileExist(absolute) || IsDirExist(absolute, /*follow_link=*/false)) {
    return absolute;
  }
  try {
    return fileindex::GetFullPath(absolute);
  } catch (const std::exception&) {  // Its first component is no share: a path as it stands.
    return absolute;
  }
}

ExitStatus PutDocument(const Arguments& arguments, const Console& console) {
  const std::string& share = arguments.positional[0];
  const std::string path = DocumentPath(arguments.positional[1]);
  const std::string share_path = SharePathOf(path);
  if (ShareNames().contains(share) && !IsSameOrBelow(share_path, "/" + share)) {
    throw Failure("'" + ForTerminal(path) + "' does not lie in the share '" + ForTerminal(share) +
                  "'");
  }
  return Do(console, "indexed: " + path, [&] {
    elastic::IndexUpsert(share, path, !arguments.Has("--no-content"));
    elastic::IndexCommit(share);
  });
}

ExitStatus GetDocument(const Arguments& arguments, const Console& console) {
  const std::string& share = arguments.positional[0];
  Json::Value request;
  request["command"] = "document_get_by_query";
  Json::Value& data = request["data"];
  data["id"] = elastic::GetFileIndexID(share);
  data["query"]["qsl"]["term"]["KAVOMDPath"] = DocumentPath(arguments.positional[1]);
  const Json::Value found = AskEngine(request);
  if (found.empty()) {
    console.err << "the path is not in the index\n";
    return kNothingFound;
  }
  console.out << (arguments.Has("--json") ? JsonToString(found[0]) + "\n"
                                          : JsonToStyledString(found[0]));
  return kDone;
}

ExitStatus RemoveDocument(const Arguments& arguments, const Console& console) {
  const std::string& share = arguments.positional[0];
  const std::string path = DocumentPath(arguments.positional[1]);
  return Do(console, "removed from the index: " + path + " and all below it", [&] {
    elastic::IndexDel(share, path);
    elastic::IndexDelDir(share, path);
    elastic::IndexCommit(share);
  });
}

const char kIndexDetails[] =
    "Each indexed share has one index in the search engine, kavoelasticd, which must be running.\n";

Command IndexCommand(const char* name, const char* arguments, const char* summary, size_t fewest,
                     size_t most, ExitStatus (*run)(const Arguments&, const Console&)) {
  return {name, arguments, summary, kIndexDetails, {}, {}, fewest, most, run};
}

}  // namespace

std::vector<Command> IndexCommands() {
  return {
      {"index list",
       "",
       "lists the indexes of the search engine",
       "Prints id, state and folder of each index, one a line. Exit status 1 when there are "
       "none.\n",
       {{"--json", nullptr, "one JSON object a line: id, state, path"}},
       {},
       0,
       0,
       ListIndexes},
      IndexCommand("index create", "SHARE", "makes the index of a share, empty", 1, 1, CreateIndex),
      IndexCommand("index delete", "SHARE", "deletes the index of a share", 1, 1, DeleteIndex),
      IndexCommand("index pause", "SHARE", "closes an index until it is resumed", 1, 1, PauseIndex),
      IndexCommand("index resume", "SHARE", "opens a paused index", 1, 1, ResumeIndex),
      IndexCommand("index rename", "SHARE NEW [FOLDER]",
                   "makes a share's index that of another share", 2, 3, RenameIndex),
      IndexCommand("index migrate", "SHARE [FOLDER]", "moves an index to another folder", 1, 2,
                   MigrateIndex),
      {"doc put",
       "SHARE PATH",
       "indexes one file or folder",
       "Puts what is known of PATH into the index of SHARE, in the place of what was there, and\n"
       "commits it. What lies below a folder is not looked at. PATH is a path of the file system\n"
       "or one that begins with the share, \"/photo/2019\", and lies in the share.\n"
       "\n"
       "  fileindex doc put photo /volume1/photo/2019/beach.jpg\n",
       {{"--no-content", nullptr, "name, size, dates and owner only"}},
       {},
       2,
       2,
       PutDocument},
      {"doc get",
       "SHARE PATH",
       "shows what the index holds of a path",
       "Prints the document of PATH as JSON. Exit status 1 when there is none.\n"
       "\n"
       "  fileindex doc get photo /photo/2019/beach.jpg | jq .KAVOMDFSSize\n",
       {{"--json", nullptr, "on one line"}},
       {},
       2,
       2,
       GetDocument},
      {"doc rm",
       "SHARE PATH",
       "takes a path out of the index",
       "Deletes the documents of PATH and of all below it, and commits. The files stay.\n"
       "\n"
       "  fileindex doc rm photo /volume1/photo/2019\n",
       {},
       {},
       2,
       2,
       RemoveDocument},
  };
}

}  // namespace vexlo::cli
