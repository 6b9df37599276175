// The search engine behind its socket, in a process of its own, beside a bare SQLite FTS5 program
// that inserts the same texts and asks the same questions with nothing in between, in the same run.
// The corpus is seeded: a third of the documents has 1.5 KB of text; names hold ideographs and raw
// bytes; paths go up to 1,000 bytes.
//
//   upsert    one request a document, as an indexer sends them; a commit every 1,000 and every
//   10,000 rename    a folder of 10,000 documents, as one compound of partial updates, as the
//   library sends it delete    the same folder by the beginning of its paths search    two words,
//   and a part of a name; 20 results with snippets
//
// The bare program keeps path and document in a table, text and name in an FTS5 table, and names in
// one of trigrams; write-ahead log and full synchronisation as in the engine.
//
// --quick makes 2,000 documents instead of 100,000. --documents=N makes N.
#include <fcntl.h>
#include <json/value.h>
#include <signal.h>
#include <sqlite3.h>
#include <sys/eventfd.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
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

#include "common/json.h"
#include "daemons/common/frame_server.h"
#include "daemons/kavoelasticd/engine.h"
#include "daemons/kavoelasticd/server.h"
#include "fileindex/elastic_control/share_index.h"
#include "kavo/sock_connection.h"

namespace {

double Seconds(const std::function<void()>& work) {
  const auto begin = std::chrono::steady_clock::now();
  work();
  return std::chrono::duration<double>(std::chrono::steady_clock::now() - begin).count();
}

// The engine in a process of its own, for as long as this object lives.
class EngineProcess {
 public:
  explicit EngineProcess(const std::string& folder) : socket_(folder + "/engine.sock") {
    int ready[2];
    if (pipe2(ready, O_CLOEXEC) != 0 || (pid_ = fork()) < 0) {
      perror("fork");
      exit(1);
    }
    if (pid_ == 0) {
      Serve(folder, ready[1]);
    }
    close(ready[1]);
    char byte = 0;
    const bool is_ready = read(ready[0], &byte, 1) == 1;
    close(ready[0]);
    if (!is_ready) {
      fputs("the engine did not start\n", stderr);
      exit(1);
    }
  }
  ~EngineProcess() {
    kill(pid_, SIGKILL);
    waitpid(pid_, nullptr, 0);
  }
  EngineProcess(const EngineProcess&) = delete;
  EngineProcess& operator=(const EngineProcess&) = delete;

  Json::Value Send(const Json::Value& request) const {
    kavodaemon::DomainSockConnection connection(socket_);
    std::string text;
    Json::Value reply;
    if (!connection.Connect(60) || !connection.Send(vexlo::JsonToString(request)) ||
        !connection.Recv(text) || !vexlo::JsonFromString(reply, text) ||
        !reply["success"].asBool() || reply["has_fail"].asBool()) {
      fprintf(stderr, "a request failed: %s\n", text.substr(0, 1000).c_str());
      exit(1);
    }
    return reply;
  }

 private:
  [[noreturn]] void Serve(const std::string& folder, int ready) const {
    vexlo::elasticd::Engine engine(folder + "/registry.json");
    vexlo::daemon::FrameServerOptions options;
    options.socket_path = socket_;
    options.handler = [&engine](const std::string& request) {
      return vexlo::elasticd::AnswerText(
          [&engine](const Json::Value& value) { return engine.Handle(value); }, request);
    };
    vexlo::daemon::FrameServer server(std::move(options));
    const bool told = write(ready, "+", 1) == 1;
    const int never = eventfd(0, EFD_CLOEXEC);
    _exit(told && server.Run(never) ? 0 : 1);
  }

  std::string socket_;
  pid_t pid_ = -1;
};

Json::Value Send(const EngineProcess& engine, const Json::Value& request) {
  return engine.Send(request);
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

// The baseline.
class Bare {
 public:
  explicit Bare(const std::string& folder) {
    Check(sqlite3_open((folder + "/bare.db").c_str(), &db_));
    Execute("PRAGMA journal_mode=WAL");
    Execute("PRAGMA synchronous=FULL");
    Execute("CREATE TABLE docs(id INTEGER PRIMARY KEY, path BLOB NOT NULL UNIQUE, m BLOB)");
    Execute("CREATE VIRTUAL TABLE ft USING fts5(name, text)");
    Execute("CREATE VIRTUAL TABLE names USING fts5(name, tokenize='trigram')");
    insert_doc_ = Prepare("INSERT INTO docs(path, m) VALUES(?, ?)");
    insert_text_ = Prepare("INSERT INTO ft(rowid, name, text) VALUES(?, ?, ?)");
    insert_name_ = Prepare("INSERT INTO names(rowid, name) VALUES(?, ?)");
  }
  ~Bare() {
    for (sqlite3_stmt* const statement : statements_) {
      sqlite3_finalize(statement);
    }
    sqlite3_close(db_);
  }
  Bare(const Bare&) = delete;
  Bare& operator=(const Bare&) = delete;

  void Execute(const char* sql) { Check(sqlite3_exec(db_, sql, nullptr, nullptr, nullptr)); }

  void Insert(const Json::Value& document) {
    const std::string path = document["KAVOMDPath"].asString();
    const std::string name = document["KAVOMDFSName"].asString();
    const std::string text = document["KAVOMDTextContent"].asString();
    const std::string all = vexlo::JsonToString(document);
    Bind(insert_doc_, 1, path);
    Bind(insert_doc_, 2, all);
    Step(insert_doc_);
    const int64_t id = sqlite3_last_insert_rowid(db_);
    sqlite3_bind_int64(insert_text_, 1, id);
    Bind(insert_text_, 2, name);
    Bind(insert_text_, 3, text);
    Step(insert_text_);
    sqlite3_bind_int64(insert_name_, 1, id);
    Bind(insert_name_, 2, name);
    Step(insert_name_);
  }

  sqlite3_stmt* Prepare(const char* sql) {
    sqlite3_stmt* statement = nullptr;
    Check(sqlite3_prepare_v2(db_, sql, -1, &statement, nullptr));
    statements_.push_back(statement);
    return statement;
  }

  // All rows of a query with one parameter; how many.
  int Ask(sqlite3_stmt* statement, const std::string& parameter) {
    int rows = 0;
    Bind(statement, 1, parameter);
    while (sqlite3_step(statement) == SQLITE_ROW) {
      ++rows;
    }
    Check(sqlite3_reset(statement));
    return rows;
  }

 private:
  void Check(int result) {
    if (result != SQLITE_OK) {
      fprintf(stderr, "SQLite: %s\n", sqlite3_errmsg(db_));
      exit(1);
    }
  }
  static void Bind(sqlite3_stmt* statement, int at, const std::string& text) {
    sqlite3_bind_text(statement, at, text.data(), static_cast<int>(text.size()), SQLITE_STATIC);
  }
  void Step(sqlite3_stmt* statement) {
    sqlite3_step(statement);
    Check(sqlite3_reset(statement));
  }

  sqlite3* db_ = nullptr;
  std::vector<sqlite3_stmt*> statements_;
  sqlite3_stmt* insert_doc_ = nullptr;
  sqlite3_stmt* insert_text_ = nullptr;
  sqlite3_stmt* insert_name_ = nullptr;
};

double Median(std::vector<double> values) {
  std::nth_element(values.begin(), values.begin() + static_cast<ptrdiff_t>(values.size() / 2),
                   values.end());
  return values[values.size() / 2];
}

Json::Value UpsertOf(const Json::Value& document) {
  Json::Value request = Command("document_upsert_by_id");
  request["data"]["doc_id"] = document["KAVOMDPath"];
  request["data"]["data"] = document;
  return request;
}

// Documents from..to through the engine and into the bare table, in turn by parts so that a noisy
// moment meets both. Prints documents a second and the ratio.
double Upsert(const EngineProcess& engine, Bare& bare, const std::vector<Json::Value>& documents,
              size_t from, size_t to, size_t commit_every) {
  double ours = 0;
  double theirs = 0;
  for (size_t begin = from; begin < to; begin += commit_every) {
    const size_t end = std::min(begin + commit_every, to);
    ours += Seconds([&] {
      for (size_t i = begin; i < end; ++i) {
        Send(engine, UpsertOf(documents[i]));
      }
      Send(engine, Command("commit"));
    });
    theirs += Seconds([&] {
      bare.Execute("BEGIN");
      for (size_t i = begin; i < end; ++i) {
        bare.Insert(documents[i]);
      }
      bare.Execute("COMMIT");
    });
  }
  const auto count = static_cast<double>(to - from);
  printf("upsert, commit every %-11zu %9.0f a second %9.0f bare: %.2f times the bare speed\n",
         commit_every, count / ours, count / theirs, theirs / ours);
  return ours / count;
}

void Query(const EngineProcess& engine, Bare& bare, const char* what, const Json::Value& data,
           sqlite3_stmt* statement, const std::string& match) {
  Json::Value request;
  request["command"] = "search";
  request["data"] = data;
  request["data"]["snippet"] = true;
  request["data"]["size"] = 20;
  constexpr int kTimes = 50;
  std::vector<double> ours;
  std::vector<double> theirs;
  unsigned total = 0;
  int rows = 0;
  for (int i = 0; i < kTimes; ++i) {
    ours.push_back(Seconds([&] { total = Send(engine, request)["total"].asUInt(); }));
    theirs.push_back(Seconds([&] { rows = bare.Ask(statement, match); }));
  }
  printf("%-32s %9.2f ms       %9.2f bare: %.2f times the bare time, %u hits (%d shown)\n", what,
         Median(ours) * 1000, Median(theirs) * 1000, Median(ours) / Median(theirs), total, rows);
}

Json::Value With(const char* key, const Json::Value& value) {
  Json::Value data;
  data[key] = value;
  return data;
}

void Run(size_t count, const std::string& folder) {
  const EngineProcess engine(folder);  // Before anything here has threads.
  Json::Value create = Command("index_create");
  create["data"]["path"] = folder + "/index";
  create["data"]["mappings"] = vexlo::fileindex::elastic::GetFileIndexMappings();
  Send(engine, create);
  Bare bare(folder);

  Corpus corpus;
  std::vector<Json::Value> documents;
  documents.reserve(count);
  for (size_t i = 0; i < count; ++i) {
    documents.push_back(corpus.Document(i));
  }
  const double each = Upsert(engine, bare, documents, 0, count / 2, 1000);
  Upsert(engine, bare, documents, count / 2, count, 10000);

  const std::string frequent = Corpus().Word();
  Corpus second;
  second.Word();
  const std::string words = frequent + " " + second.Word();
  Query(
      engine, bare, "two words, with snippets", With("words", words),
      bare.Prepare("SELECT docs.path, snippet(ft, -1, '<', '>', '...', 16) FROM ft CROSS JOIN docs "
                   "ON docs.id = ft.rowid WHERE ft MATCH ? ORDER BY bm25(ft) LIMIT 20"),
      words);
  const std::string part = documents[1]["KAVOMDFSName"].asString().substr(1, 5);
  Query(engine, bare, "part of a name, 5 letters", With("name", part),
        bare.Prepare("SELECT docs.path FROM names CROSS JOIN docs ON docs.id = names.rowid "
                     "WHERE names MATCH ? ORDER BY bm25(names) LIMIT 20"),
        "\"" + part + "\"");

  const size_t moved = std::min<size_t>(count, 10000);
  const std::string from = "/volume1/share/folder0";
  const std::string to = "/volume1/share/renamed folder";
  Json::Value rename;
  for (size_t i = 0; i < moved; ++i) {
    rename["compound"].append(Rename(documents[i], from, to));
  }
  const double renamed = Seconds([&] {
    Send(engine, rename);
    Send(engine, Command("commit"));
  });
  printf("%-32s %9.2f s for %zu: %.1f times as fast as upserting them\n", "rename a folder",
         renamed, moved, each * static_cast<double>(moved) / renamed);
  Json::Value remove = Command("document_del_by_query");
  remove["data"]["query"]["qsl"]["prefix"]["KAVOMDPath"] = to + "/";
  const double removed = Seconds([&] {
    Send(engine, remove);
    Send(engine, Command("commit"));
  });
  printf("%-32s %9.2f s for %zu\n", "delete the folder", removed, moved);
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
