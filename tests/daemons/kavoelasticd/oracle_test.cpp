// Random changes to few paths, beside a map that does the same plainly: whatever the index is asked
// afterwards, it must answer as the map does. A text index that forgets something else than what it
// learnt shows here.
#include <gtest/gtest.h>

#include <functional>
#include <map>
#include <random>
#include <string>
#include <vector>

#include "daemons/common/entry_digest.h"
#include "daemons/kavoelasticd/engine_fixture.h"
#include "daemons/kavoelasticd/session.h"

namespace {

class Oracle {
 public:
  explicit Oracle(unsigned seed) : random_(seed), has_odd_names_(seed % 2 == 1) {}

  void Step() {
    const std::string path = Path();
    switch (random_() % 8) {
      case 0:
      case 1:
      case 2: {
        const Json::Value document = MakeDocument(path, Fields());
        Send(WriteRequest("document_upsert_by_id", path, document), "ok");
        documents_[path] = document;
        break;
      }
      case 3: {
        const Json::Value data = Parsed(Fields());
        Send(WriteRequest("document_set_by_id", path, data), Known(path));
        if (documents_.contains(path)) {
          Merge(path, data);
        }
        break;
      }
      case 4:
      case 5:
        Rename(path, Path());
        break;
      case 6:
        Send(WriteRequest("document_del_by_id", path, Json::Value()), "ok");
        documents_.erase(path);
        break;
      default:
        Other(path);
    }
  }

  void Compare() {
    for (const std::string word : {"alpha", "beta", "gamma", "delta"}) {
      EXPECT_EQ(engine_.Query(R"({"term":{"KAVOMDTextContent":")" + word + "\"}}", kAll),
                Having("KAVOMDTextContent", word));
      EXPECT_EQ(engine_.Query(R"({"term":{"Note":")" + word + "\"}}", kAll), Having("Note", word));
      EXPECT_EQ(Found(R"("words":")" + word + "\""), Having("KAVOMDTextContent", word, "Note"));
    }
    for (const std::string letter : {"a", "b", "c", "\xff"}) {
      EXPECT_EQ(Found(R"("name":")" + letter + "\""),
                Having("KAVOMDSearchFileName", letter, "", "/" + letter));
      const std::string folder = "/" + letter;
      for (const std::string field : {"KAVOMDParent", "KAVOMDIdentifier"}) {
        EXPECT_EQ(engine_.Query(R"({"term":{")" + field + R"(":")" + folder + "\"}}", kAll),
                  Having(field, folder));
      }
      EXPECT_EQ(engine_.Query(R"({"term":{"KAVOMDSearchAncestor":")" + folder + "\"}}", kAll),
                HavingAncestor(folder));
    }
    const Json::Value found = engine_.Documents(R"({"prefix":{"KAVOMDPath":"/"}})", kAll);
    ASSERT_EQ(found.size(), documents_.size());
    Json::ArrayIndex i = 0;
    for (const auto& [path, document] : documents_) {
      EXPECT_EQ(found[i++], document) << path;
    }
    CompareFolders();
  }

 private:
  static constexpr char kAll[] = R"({"size":100})";

  // The paths that a search finds, as Having() gives them.
  std::string Found(const std::string& data) {
    const std::string sort = random_() % 2 == 0 ? R"("sort":"path",)" : "";
    EXPECT_EQ(engine_.Do("commit"), "ok");
    const Json::Value reply =
        engine_.Send("search", Parsed("{" + sort + R"("size":100,)" + data + "}"));
    std::map<std::string, Json::Value> hits;
    for (const Json::Value& hit : reply["data"]) {
      hits[hit["path"].asString()] = hit;
    }
    EXPECT_EQ(reply["total"].asUInt(), hits.size());
    return PathsIf(hits, [](const Json::Value& /*hit*/) { return true; });
  }

  // The digests of the folders, and what stands directly in each, are those of the map.
  void CompareFolders() {
    const Json::Value reply = engine_.Send("folder_digests", Parsed(R"({"below":"/"})"))["data"];
    std::map<std::string, vexlo::daemon::FolderDigest> want;
    std::map<std::string, std::string> paths;
    for (const auto& [path, document] : documents_) {
      const std::string folder = path.substr(0, path.rfind('/') + 1);
      const Json::Value& stamp = document["FileIndexStamp"];
      vexlo::daemon::EntryFacts facts;
      facts.is_settled = stamp.isObject() && stamp["ctime"].isInt64() && !stamp["young"].asBool();
      if (facts.is_settled) {
        facts.size = stamp["size"].asInt64();
        facts.mtime_ns = stamp["mtime"].asInt64();
        facts.ctime_ns = stamp["ctime"].asInt64();
        facts.content = stamp["content"].asBool();
      }
      want[folder].Add(
          vexlo::daemon::EntryHash(reply["seed"].asUInt64(), path.substr(folder.size()), facts));
      paths[folder] += (paths[folder].empty() ? "" : " ") + path;
    }
    std::map<std::string, vexlo::daemon::FolderDigest> got;
    for (const Json::Value& folder : reply["folders"]) {
      got[folder[0].asString()] = {folder[1].asUInt64(), folder[2].asUInt64()};
      EXPECT_EQ(engine_.Query(R"({"prefix":{"KAVOMDPath":")" + folder[0].asString() + "\"}}",
                              R"({"size":100,"flat":true})"),
                paths[folder[0].asString()]);
    }
    EXPECT_EQ(got, want);
  }

  // Of a file as the index daemon tells it, or what may be taken for it and is none.
  std::string Stamp() {
    const std::string stamp = R"({"ctime":)" + std::to_string(random_() % 3) +
                              R"(,"inode":18446744073709551615,"mtime":-1700000000000000000)";
    switch (random_() % 5) {
      case 0:
        return stamp + R"(,"content":true,"size":7})";
      case 1:
        return stamp + R"(,"young":true,"size":7})";
      case 2:
        return R"({"ctime":"x"})";
      case 3:
        return "[5]";
      default:
        return stamp + R"(,"size":)" + std::to_string(random_() % 2) + "}";
    }
  }

  std::string Path() {
    const std::string folders[] = {"/a", "/b", "/a/b", "/c", "/a!", "/a0"};
    const std::string names[] = {
        "/a", "/b", "/c", "/\xff", "/\u00e9", "/e\u0301", {"/\n\"\\\0s", 6}};
    return folders[random_() % 6] + names[random_() % 4 + (has_odd_names_ ? 3 : 0)];
  }

  // A text of random words, short or long.
  std::string Fields() {
    const std::string words[] = {"alpha", "beta", "gamma", "delta"};
    std::string text = words[random_() % 4];
    for (size_t more = random_() % 4; more > 0; --more) {
      text += " " + words[random_() % 4];
    }
    text += random_() % 3 == 0 ? std::string(500, 'x') : "";
    const std::string word = words[random_() % 4];
    switch (random_() % 4) {
      case 0:
        return R"({"KAVOMDTextContent":")" + text + R"(","Note":")" + word + "\"}";
      case 1:
        return R"({"Note":")" + text + R"(","KAVOMDIdentifier":")" +
               (random_() % 2 == 0 ? word : "/a") + "\"}";
      case 2:
        return R"({"KAVOMDTextContent":")" + text + R"(","Quiet text":")" + word + "\"}";
      default:
        return R"({"KAVOMDFSSize":)" + std::to_string(random_() % 3) + R"(,"FileIndexStamp":)" +
               Stamp() + "}";
    }
  }

  std::string Known(const std::string& path) const {
    return documents_.contains(path) ? "ok" : "2006";
  }

  void Send(const Json::Value& request, const std::string& want) {
    if (random_() % 2 == 0) {
      EXPECT_EQ(Answer(engine_.Send(request)), want) << request;
      return;
    }
    Json::Value list;
    list["compound"].append(request);
    EXPECT_EQ(Answer(engine_.Send(list)["data"][0]), want) << request;
  }

  void Merge(const std::string& path, const Json::Value& data) {
    Json::Value document = documents_[path];
    for (const std::string& name : data.getMemberNames()) {
      document[name] = data[name];
    }
    documents_.erase(path);
    documents_[document["KAVOMDPath"].asString()] = document;
  }

  void Rename(const std::string& from, const std::string& to) {
    Json::Value request = RenameRequest(from, to);
    if (random_() % 3 == 0) {  // Only the path: the other fields stay what they were.
      request["data"]["data"] = Json::Value();
      request["data"]["data"]["KAVOMDPath"] = to;
    }
    Send(request, Known(from));
    if (documents_.contains(from)) {
      Merge(from, request["data"]["data"]);
    }
  }

  void MoveFolder(const std::string& from, const std::string& to) {
    if ((from + "/").starts_with(to + "/") || (to + "/").starts_with(from + "/")) {
      return;
    }
    std::vector<std::string> fields = {"KAVOMDParent", "KAVOMDSearchAncestor"};
    const char* const more[] = {"KAVOMDDisplayName", "Unheard of", "KAVOMDPath"};
    if (random_() % 2 == 0) {
      fields.emplace_back(more[random_() % 3]);
    }
    Json::Value move;
    move["from"] = from;
    move["to"] = to;
    move["size"] = 1 + random_() % 3;
    for (const std::string& name : fields) {
      move["folder_field"].append(name);
    }
    do {
      const Json::Value answer = engine_.Send("document_move_below", move)["data"];
      EXPECT_EQ(answer["failed"], Json::Value(Json::arrayValue));
      move["after"] = answer["after"];
    } while (move["after"].isString());
    std::vector<std::string> below;
    for (const auto& [path, document] : documents_) {
      if (path.starts_with(from + "/")) {
        below.push_back(path);
      }
    }
    for (const std::string& path : below) {
      const std::string moved = to + path.substr(from.size());
      Json::Value data;
      for (const std::string& name : fields) {
        data[name] = moved.substr(0, moved.rfind('/'));
      }
      data["KAVOMDPath"] = moved;
      Merge(path, data);
    }
  }

  void Other(const std::string& path) {
    if (random_() % 4 == 0) {
      const std::string folders[] = {"/a", "/b", "/c", "/a/b"};
      MoveFolder(folders[random_() % 4], folders[random_() % 4]);
    }
    if (random_() % 4 == 0) {
      engine_.Restart();
    }
    if (random_() % 4 == 0) {
      while (engine_.Engine().CommitIdle(std::chrono::seconds(0))) {
      }
    }
    const std::string below = path.substr(0, path.rfind('/')) + "/";
    if (random_() % 4 == 0) {
      EXPECT_EQ(engine_.Do("document_del_by_query",
                           R"({"query":{"qsl":{"prefix":{"KAVOMDPath":")" + below + "\"}}}}"),
                "ok");
      std::erase_if(documents_, [&](const auto& entry) { return entry.first.starts_with(below); });
    }
    EXPECT_EQ(engine_.Do("commit"), "ok");
  }

  // The paths of the documents with the word in one of the fields, if they end so.
  std::string Having(const std::string& field, const std::string& word, const char* other = "",
                     const std::string& ending = "") const {
    return PathsIf(documents_, [&](const Json::Value& document) {
      const std::string texts = " " + document[field].asString() + " " + document[other].asString();
      // A long tail of the text makes its last word another one.
      return (texts + " ").find(" " + word + " ") != std::string::npos &&
             document["KAVOMDPath"].asString().ends_with(ending);
    });
  }
  std::string HavingAncestor(const std::string& folder) const {
    return PathsIf(documents_, [&](const Json::Value& document) {
      return (document["KAVOMDSearchAncestor"].asString() + "/").starts_with(folder + "/");
    });
  }
  static std::string PathsIf(const std::map<std::string, Json::Value>& documents,
                             const std::function<bool(const Json::Value&)>& is_one) {
    std::string paths;
    for (const auto& [path, document] : documents) {
      if (is_one(document)) {
        paths += (paths.empty() ? "" : " ") + path;
      }
    }
    return paths;
  }

  std::mt19937 random_;
  const bool has_odd_names_;
  EngineFixture engine_;
  std::map<std::string, Json::Value> documents_;
};

TEST(Oracle, RandomChangesAnswerAsAPlainMapDoes) {
  for (unsigned seed = 0; seed < 12; ++seed) {
    SCOPED_TRACE(seed);
    Oracle oracle(seed);
    for (int i = 0; i < 120; ++i) {
      oracle.Step();
      if (i % 30 == 29) {
        oracle.Compare();
      }
    }
    if (testing::Test::HasFailure()) {
      break;
    }
  }
}

}  // namespace
