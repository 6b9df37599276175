// The engine's core without its socket: what each command costs on a seeded corpus. A third of the
// documents has 1.5 KB of text; names hold ideographs and raw bytes; paths go up to 1,000 bytes.
//
//   upsert        compounds of 1,000, a commit behind each
//   upsert again  10,000 of them once more, with other text
//   rename        a folder of 10,000 documents, as one compound of partial updates
//   delete        the same folder by the beginning of its paths
//   search        words, phrases, parts of names, filters; 20 results with snippets
//
// --quick makes 2,000 documents instead of 100,000. --documents=N makes N.
#include <json/reader.h>
#include <json/value.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <unistd.h>

#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <functional>
#include <memory>
#include <random>
#include <string>
#include <string_view>
#include <vector>

#include "daemons/kavoelasticd/engine.h"

namespace {

using vexlo::elasticd::Engine;

constexpr char kMappings[] = R"({"property_id":"KAVOMDPath","properties":{
  "KAVOMDPath":{"analyzer":"keyword","required":true,"_all":false},
  "KAVOMDFSName":{"analyzer":"keyword","_all":false},
  "KAVOMDPrivilege":{"analyzer":"keyword","_all":false},
  "KAVOMDOwnerUserID":{"analyzer":"keyword","_all":false},
  "KAVOMDOwnerGroupID":{"analyzer":"keyword","_all":false},
  "KAVOMDParent":{"analyzer":"keyword","_all":false},
  "KAVOMDExtension":{"analyzer":"keyword","_all":false},
  "KAVOMDIsDir":{"type":"bool","_all":false},"KAVOMDFSSize":{"type":"int"},
  "KAVOMDFSContentChangeDate":{"type":"int"},"KAVOMDFSCreationDate":{"type":"int"},
  "KAVOMDTitle":{"type":"text"},"KAVOMDTextContent":{"type":"text"},
  "KAVOMDSearchFileName":{"type":"text","analyzer":"white space","preprocess":["tolower","ngram"]},
  "KAVOMDSearchAncestor":{"type":"text","analyzer":"white space escaped",
                          "preprocess":["list_ancestor"],"_all":false}}})";

double Seconds(const std::function<void()>& work) {
  const auto begin = std::chrono::steady_clock::now();
  work();
  return std::chrono::duration<double>(std::chrono::steady_clock::now() - begin).count();
}

Json::Value Send(Engine& engine, const Json::Value& request) {
  Json::Value reply = engine.Handle(request);
  if (!reply["success"].asBool() || reply["has_fail"].asBool()) {
    fprintf(stderr, "a request failed: %s\n", reply["error"]["msg"].asCString());
    exit(1);
  }
  return reply;
}

Json::Value Command(const std::string& command) {
  Json::Value request;
  request["command"] = command;
  request["data"]["id"] = "bench";
  return request;
}

class Corpus {
 public:
  Corpus() {
    for (int i = 0; i < 30000; ++i) {
      std::string word;
      for (size_t letters = 3 + random_() % 8; letters > 0; --letters) {
        word += static_cast<char>('a' + random_() % 26);
      }
      words_.push_back(word);
    }
  }

  std::string Word() {
    // The squared number makes few words frequent.
    const double u = static_cast<double>(random_() % 1000000) / 1e6;
    return words_[static_cast<size_t>(u * u * u * 29999)];
  }

  std::string Folder(size_t i) {
    std::string folder = "/volume1/share/folder" + std::to_string(i / 10000);
    for (size_t depth = (i / 40) % 6; depth > 0; --depth) {
      folder += "/level " + std::to_string((i / 40) % (10 + depth * 7));
    }
    return i % 500 == 0
               ? folder + std::string(900, 'd').insert(250, "/").insert(500, "/").insert(750, "/")
               : folder;
  }

  Json::Value Document(size_t i) {
    const std::string parent = Folder(i);
    std::string name = Word() + "_" + Word() + std::to_string(i);
    name += i % 17 == 0 ? "\u5199\u771f\u65c5\u884c" : i % 97 == 0 ? "\xff\xfe" : "";
    name += i % 3 == 0 ? ".txt" : i % 3 == 1 ? ".jpg" : ".pdf";
    Json::Value data;
    data["KAVOMDPath"] = parent + "/" + name;
    for (const char* field : {"KAVOMDParent", "KAVOMDSearchAncestor"}) {
      data[field] = parent;
    }
    for (const char* field : {"KAVOMDFSName", "KAVOMDSearchFileName", "KAVOMDDisplayName"}) {
      data[field] = name;
    }
    for (const char* field : {"KAVOMDExtension", "KAVOMDKind"}) {
      data[field] = name.substr(name.size() - 3);
    }
    data["KAVOMDPrivilege"] = "rwxr-xr-x";
    data["KAVOMDOwnerUserID"] = "1026";
    data["KAVOMDOwnerGroupID"] = "100";
    data["KAVOMDIsDir"] = false;
    data["KAVOMDFSSize"] = static_cast<int>(random_() % 100000000);
    data["KAVOMDFSContentChangeDate"] = static_cast<int>(1500000000 + random_() % 200000000);
    data["KAVOMDFSCreationDate"] = static_cast<int>(1500000000 + random_() % 200000000);
    if (i % 3 == 0) {
      std::string text;
      while (text.size() < 1500) {
        text += Word() + " ";
      }
      data["KAVOMDTextContent"] = text;
    }
    return data;
  }

  Json::Value Upserts(size_t from, size_t to, std::vector<Json::Value>* made) {
    Json::Value request;
    for (size_t i = from; i < to; ++i) {
      Json::Value item = Command("document_upsert_by_id");
      item["data"]["data"] = Document(i);
      item["data"]["doc_id"] = item["data"]["data"]["KAVOMDPath"];
      made->push_back(item["data"]["data"]);
      request["compound"].append(item);
    }
    return request;
  }

 private:
  std::mt19937_64 random_{1};
  std::vector<std::string> words_;
};

// The document with the folder `from` of its path replaced by `to`, as the library asks for it.
Json::Value Rename(const Json::Value& document, const std::string& from, const std::string& to) {
  const std::string parent = to + document["KAVOMDParent"].asString().substr(from.size());
  const std::string name = document["KAVOMDFSName"].asString();
  Json::Value item = Command("document_set_by_id");
  item["data"]["doc_id"] = document["KAVOMDPath"];
  Json::Value& data = item["data"]["data"];
  data["KAVOMDParent"] = parent;
  data["KAVOMDPath"] = parent + "/" + name;
  data["KAVOMDSearchFileName"] = name;
  data["KAVOMDSearchAncestor"] = parent;
  return item;
}

void Queries(Engine& engine, const std::vector<std::pair<const char*, Json::Value>>& searches) {
  for (const auto& [name, data] : searches) {
    Json::Value request;
    request["command"] = "search";
    request["data"] = data;
    request["data"]["snippet"] = true;
    request["data"]["size"] = 20;
    unsigned total = 0;
    constexpr int kTimes = 20;
    const double seconds = Seconds([&] {
      for (int i = 0; i < kTimes; ++i) {
        total = Send(engine, request)["total"].asUInt();
      }
    });
    printf("%-32s %8.2f ms %9u hits\n", name, seconds * 1000 / kTimes, total);
  }
}

Json::Value With(const char* key, const Json::Value& value) {
  Json::Value data;
  data[key] = value;
  return data;
}

void Run(size_t documents, const std::string& folder) {
  Engine engine(folder + "/registry.json");
  Json::Value create = Command("index_create");
  create["data"]["path"] = folder + "/index";
  Json::CharReaderBuilder reader;
  std::string errors;
  const std::unique_ptr<Json::CharReader> parser(reader.newCharReader());
  parser->parse(kMappings, kMappings + sizeof(kMappings) - 1, &create["data"]["mappings"], &errors);
  Send(engine, create);

  Corpus corpus;
  std::vector<Json::Value> made;
  double upsert = 0;
  for (size_t i = 0; i < documents; i += 1000) {
    const Json::Value request = corpus.Upserts(i, std::min(i + 1000, documents), &made);
    upsert += Seconds([&] {
      Send(engine, request);
      Send(engine, Command("commit"));
    });
  }
  const auto rate = static_cast<double>(documents) / upsert;
  printf("%-32s %8.0f documents/s\n", "upsert", rate);
  const size_t folder_size = std::min<size_t>(documents, 10000);

  Json::Value rename;
  const std::string from = "/volume1/share/folder0";
  const std::string to = "/volume1/share/renamed folder";
  for (size_t i = 0; i < folder_size; ++i) {
    rename["compound"].append(Rename(made[i], from, to));
  }
  const double renamed = Seconds([&] { Send(engine, rename); });
  const double committed = Seconds([&] { Send(engine, Command("commit")); });
  const double again = static_cast<double>(folder_size) / rate;
  printf("%-32s %8.3f s + commit %.3f s for %zu: %.1f times as fast as upserting\n", "rename",
         renamed, committed, folder_size, again / (renamed + committed));

  const std::string name = made[1]["KAVOMDFSName"].asString();
  Json::Value page = Command("document_get_by_query");
  page["data"]["query"]["qsl"]["prefix"]["KAVOMDPath"] = to + "/";
  page["data"]["query"]["size"] = 10000;
  page["data"]["query"]["load_field"].append("KAVOMDPath");
  page["data"]["query"]["load_field"].append("KAVOMDFSName");
  page["data"]["query"]["load_field"].append("KAVOMDParent");
  const double listed = Seconds([&] { Send(engine, page); });
  printf("%-32s %8.3f s\n", "list 10,000 with three fields", listed);

  Corpus same;
  const std::string common = same.Word();
  Json::Value filtered = With("words", common);
  filtered["below"] = to;
  filtered["types"].append("txt");
  Queries(engine,
          {{"word", With("words", common)},
           {"two words", With("words", common + " " + same.Word())},
           {"phrase",
            With("words", "\"" + made[0]["KAVOMDTextContent"].asString().substr(0, 14) + "\"")},
           {"beginning of a word", With("words", common.substr(0, 3) + "*")},
           {"word, folder and type", filtered},
           {"part of a name, 5 letters", With("name", name.substr(1, 5))},
           {"part of a name, 2 ideographs", With("name", "\u65c5\u884c")},
           {"part of a name, 1 letter", With("name", "q")},
           {"below a folder", With("below", to)}});

  Json::Value remove = Command("document_del_by_query");
  remove["data"]["query"]["qsl"]["prefix"]["KAVOMDPath"] = to + "/";
  const double removed = Seconds([&] {
    Send(engine, remove);
    Send(engine, Command("commit"));
  });
  printf("%-32s %8.3f s\n", "delete the folder", removed);

  struct stat status;
  stat((folder + "/index/index.db").c_str(), &status);
  struct rusage usage;
  getrusage(RUSAGE_SELF, &usage);
  printf("%-32s %8.1f MB\n%-32s %8.1f MB with the corpus\n", "on disk",
         static_cast<double>(status.st_size) / 1e6, "peak memory",
         static_cast<double>(usage.ru_maxrss) / 1e3);
  Send(engine, Command("index_pause"));
  const double opened = Seconds([&] { Send(engine, Command("index_resume")); });
  printf("%-32s %8.3f s\n", "open, with the check", opened);
}

}  // namespace

int main(int argc, char** argv) {
  size_t documents = 100000;
  for (int i = 1; i < argc; ++i) {
    const std::string_view argument = argv[i];
    if (argument == "--quick") {
      documents = 2000;
    } else if (argument.starts_with("--documents=")) {
      documents = strtoul(argv[i] + 12, nullptr, 10);
    }
  }
  std::string folder = "/tmp/engine-bench.XXXXXX";
  if (mkdtemp(folder.data()) == nullptr) {
    perror("mkdtemp");
    return 1;
  }
  Run(documents, folder);
  std::filesystem::remove_all(folder);
  return 0;
}
