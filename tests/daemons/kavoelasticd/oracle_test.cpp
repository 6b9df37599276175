// Random changes to few paths, beside a map that does the same plainly: whatever the index is asked
// afterwards, it must answer as the map does. A text index that forgets something else than what it
// learnt shows here.
#include <gtest/gtest.h>

#include <map>
#include <random>
#include <string>

#include "daemons/kavoelasticd/engine_fixture.h"

namespace {

class Oracle {
 public:
  explicit Oracle(unsigned seed) : random_(seed) {}

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
      EXPECT_EQ(engine_.Query(R"({"term":{"KAVOMDIdentifier":")" + word + "\"}}", kAll),
                Having("KAVOMDIdentifier", word));
      EXPECT_EQ(engine_.Search(R"({"sort":"path","size":100,"words":")" + word + "\"}"),
                Having("KAVOMDTextContent", word, "Note"));
    }
    for (const std::string letter : {"a", "b", "c"}) {
      EXPECT_EQ(engine_.Search(R"({"sort":"path","size":100,"name":")" + letter + "\"}"),
                Having("KAVOMDSearchFileName", letter, "", "/" + letter));
      EXPECT_EQ(engine_.Query(R"({"term":{"KAVOMDParent":"/)" + letter + "\"}}", kAll),
                Having("KAVOMDParent", "/" + letter));
    }
    std::string all;
    const Json::Value found = engine_.Documents(R"({"prefix":{"KAVOMDPath":"/"}})", kAll);
    ASSERT_EQ(found.size(), documents_.size());
    Json::ArrayIndex i = 0;
    for (const auto& [path, document] : documents_) {
      EXPECT_EQ(found[i++], document) << path;
    }
  }

 private:
  static constexpr char kAll[] = R"({"size":100})";

  std::string Path() {
    const std::string folders[] = {"/a", "/b", "/a/b", "/c"};
    const std::string names[] = {"/a", "/b", "/c"};
    return folders[random_() % 4] + names[random_() % 3];
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
        return R"({"Note":")" + text + R"(","KAVOMDIdentifier":")" + word + "\"}";
      case 2:
        return R"({"KAVOMDTextContent":")" + text + R"(","Quiet text":")" + word + "\"}";
      default:
        return R"({"KAVOMDFSSize":)" + std::to_string(random_() % 3) + "}";
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

  void Other(const std::string& path) {
    if (random_() % 4 == 0) {
      engine_.Restart();
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
  std::string Having(const char* field, const std::string& word, const char* other = "",
                     const std::string& ending = "") const {
    std::string paths;
    for (const auto& [path, document] : documents_) {
      const std::string texts = " " + document[field].asString() + " " + document[other].asString();
      // A long tail of the text makes its last word another one.
      const bool has = (texts + " ").find(" " + word + " ") != std::string::npos;
      if (has && path.ends_with(ending)) {
        paths += (paths.empty() ? "" : " ") + path;
      }
    }
    return paths;
  }

  std::mt19937 random_;
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
