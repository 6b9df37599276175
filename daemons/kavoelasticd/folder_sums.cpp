#include "daemons/kavoelasticd/folder_sums.h"

#include <charconv>
#include <optional>
#include <utility>

#include "daemons/kavoelasticd/commands.h"
#include "daemons/kavoelasticd/failure.h"
#include "daemons/kavoelasticd/fields.h"
#include "daemons/kavoelasticd/query.h"
#include "daemons/kavoelasticd/search.h"

namespace vexlo::elasticd {

using daemon::EntryFacts;
using daemon::FolderDigest;

namespace {

constexpr size_t kDefaultPage = 1000;

// A folder's path with a slash behind it: in the order of these a folder comes right before what is
// below it, and that before the next folder.
std::string KeyOf(const std::string& path) { return path.substr(0, path.rfind('/') + 1); }

std::string_view NameOf(const std::string& path) {
  return std::string_view(path).substr(path.rfind('/') + 1);
}

uint64_t SeedOf(Connection& db) {
  Sql token(db, "SELECT v FROM meta WHERE k = 'token'");
  if (!token.Row()) {
    throw Failure(Code::kIndexDamaged, "the database has no token");
  }
  return daemon::EntrySeed(token.BytesAt(0));
}

// Reads the stamp as the index daemon writes it. Whatever else there is counts as a file that can
// never be told to be current, so that it is looked at.
class StampText {
 public:
  explicit StampText(std::string_view text) : text_(text) {}

  std::optional<EntryFacts> Read() {
    EntryFacts facts;
    uint64_t inode = 0;
    unsigned found = 0;
    const auto is_new = [&](unsigned bit) {
      return (std::exchange(found, found | bit) & bit) == 0;
    };
    char before = '{';
    while (Take(before) && Take('"')) {
      const size_t end = text_.find('"');
      const std::string_view name = text_.substr(0, end);
      text_.remove_prefix(end == std::string_view::npos ? text_.size() : end + 1);
      bool is_young = false;
      const bool is_read =
          Take(':') && ((name == "size" && is_new(1) && Number(&facts.size)) ||
                        (name == "mtime" && is_new(2) && Number(&facts.mtime_ns)) ||
                        (name == "ctime" && is_new(4) && Number(&facts.ctime_ns)) ||
                        (name == "inode" && is_new(8) && Number(&inode)) ||
                        (name == "content" && is_new(16) && Truth(&facts.content)) ||
                        (name == "young" && is_new(32) && Truth(&is_young)));
      if (!is_read || is_young) {
        return std::nullopt;
      }
      before = ',';
    }
    constexpr unsigned kRequired = 1 | 2 | 4 | 8;
    return text_ == "}" && (found & kRequired) == kRequired ? std::optional(facts) : std::nullopt;
  }

 private:
  bool Take(char c) {
    if (text_.empty() || text_.front() != c) {
      return false;
    }
    text_.remove_prefix(1);
    return true;
  }
  template <typename T>
  bool Number(T* out) {
    const char* const end = text_.data() + text_.size();
    const auto [behind, error] = std::from_chars(text_.data(), end, *out);
    text_.remove_prefix(static_cast<size_t>(behind - text_.data()));
    return error == std::errc();
  }
  bool Truth(bool* out) {
    for (const auto& [word, value] :
         {std::pair<std::string_view, bool>("true", true), {"false", false}}) {
      if (text_.starts_with(word)) {
        text_.remove_prefix(word.size());
        *out = value;
        return true;
      }
    }
    return false;
  }

  std::string_view text_;
};

EntryFacts FactsOf(Session& session, const Record& record) {
  const auto field = session.IdOf(kStampField);
  const Item* const item = field ? record.Find(*field) : nullptr;
  std::optional<EntryFacts> facts;
  if (item != nullptr && item->kind == Kind::kJson) {
    facts = StampText(item->bytes).Read();
  }
  EntryFacts unsettled;
  unsettled.is_settled = false;
  return facts.value_or(unsettled);
}

// Its bits.
int64_t Signed(uint64_t sum) { return static_cast<int64_t>(sum); }

}  // namespace

const char kMakeFolderSums[] =
    "CREATE TABLE folders(path BLOB PRIMARY KEY, count INTEGER NOT NULL, sum INTEGER NOT NULL)"
    " WITHOUT ROWID;";

uint64_t FolderSums::HashOf(const std::string& path, const Record& record) {
  if (!seed_) {
    seed_ = SeedOf(session_.db);
  }
  return daemon::EntryHash(*seed_, NameOf(path), FactsOf(session_, record));
}

void FolderSums::Change(const StoredDocument& before, const StoredDocument& after) {
  if (!before.path.empty()) {
    changes_[KeyOf(before.path)].Remove(HashOf(before.path, before.record));
  }
  if (!after.path.empty()) {
    changes_[KeyOf(after.path)].Add(HashOf(after.path, after.record));
  }
}

void FolderSums::Move(const std::string& path_old, const std::string& path, uint64_t hash) {
  changes_[KeyOf(path_old)].Remove(hash);
  changes_[KeyOf(path)].Add(hash);
}

void FolderSums::Write() {
  for (const auto& [key, change] : changes_) {
    if (change == FolderDigest()) {
      continue;
    }
    FolderDigest digest = change;
    {
      Sql row(session_.db, "SELECT count, sum FROM folders WHERE path = ?");
      if (row.Blob(key).Row()) {
        digest.Add({static_cast<uint64_t>(row.IntAt(0)), static_cast<uint64_t>(row.IntAt(1))});
      }
    }
    if (digest == FolderDigest()) {
      Sql(session_.db, "DELETE FROM folders WHERE path = ?").Blob(key).Run();
    } else {
      Sql(session_.db, "INSERT OR REPLACE INTO folders VALUES(?,?,?)")
          .Blob(key)
          .Int(Signed(digest.count))
          .Int(Signed(digest.sum))
          .Run();
    }
  }
  Clear();
}

Json::Value GetFolderDigests(Session& session, const Json::Value& data) {
  std::string root = RequiredText(data, "below");
  root += root.ends_with('/') ? "" : "/";
  if (!data["after"].isNull() && !data["after"].isString()) {
    throw Failure(Code::kBadRequest, "after is no path");
  }
  const std::string after = data["after"].asString();
  std::string end;
  EndOfPrefix(root, &end);
  Json::Value answer;
  answer["seed"] = Json::Value(static_cast<Json::UInt64>(SeedOf(session.db)));
  Json::Value& folders = answer["folders"] = Json::arrayValue;
  Sql rows(
      session.db,
      "SELECT path, count, sum FROM folders WHERE path >= ? AND path < ? ORDER BY path LIMIT ?");
  const std::string begin = after < root ? root : after + '\0';
  rows.Blob(begin).Blob(end).Int(static_cast<int64_t>(PageNumber(data, "size", kDefaultPage)));
  while (rows.Row()) {
    Json::Value folder(Json::arrayValue);
    folder.append(rows.StringAt(0));
    folder.append(static_cast<Json::UInt64>(rows.IntAt(1)));
    folder.append(static_cast<Json::UInt64>(rows.IntAt(2)));
    folders.append(std::move(folder));
  }
  return answer;
}

}  // namespace vexlo::elasticd
