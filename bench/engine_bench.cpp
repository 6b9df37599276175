// The search engine behind its socket, in a process of its own, beside a bare SQLite FTS5 program
// that inserts the same texts and asks the same questions with nothing in between, in the same run.
// The corpus is seeded: a third of the documents has 1.5 KB of text; names hold ideographs and raw
// bytes; paths go up to 1,000 bytes.
//
//   upsert   one request and one connection a document, as the library sends them, from one client
//            thread and from four, as an indexer with several workers does; a commit every 1,000
//            and every 10,000. The texts of the requests are made before; sending them and reading
//            the replies counts, on the same processors as the engine's work.
//   rename   a folder of 10,000 documents, as one compound of partial updates
//   delete   the same folder by the beginning of its paths
//   search   two frequent words, and a part of a name; the number of all hits, and the best 20 with
//            snippets; connecting, and parsing the reply, count
//
// The bare program runs prepared statements on one connection, on texts that are made before too. A
// document is a row of its path, which is unique, and itself as JSON; its text and name in an FTS5
// table (porter, unicode61; it keeps their texts, for the snippets); and its name in an FTS5 table
// of trigrams. Write-ahead log, full synchronisation, the pages and the caches are as in the
// engine. Its queries count the hits, then read the best 20 by bm25 with path and snippet; in the
// order of "rank", so that only those 20 get a snippet. It does less than the engine: it looks for
// no document to replace, checks no value, stems no second form of a word, has no parts of two
// letters, and keeps no values to look documents up or filter them by.
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
#include <atomic>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <functional>
#include <memory>
#include <random>
#include <string>
#include <string_view>
#include <thread>
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
    return SendText(vexlo::JsonToString(request));
  }

  Json::Value SendText(const std::string& request) const {
    kavodaemon::DomainSockConnection connection(socket_);
    std::string text;
    Json::Value reply;
    if (!connection.Connect(60) || !connection.Send(request) || !connection.Recv(text) ||
        !vexlo::JsonFromString(reply, text) || !reply["success"].asBool() ||
        reply["has_fail"].asBool()) {
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

  // The most frequent word but `rank` of at least `letters`.
  std::string Frequent(size_t rank, size_t letters) const {
    while (words_[rank].size() < letters) {
      ++rank;
    }
    return words_[rank];
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
    Execute("PRAGMA page_size=8192");
    Execute("PRAGMA journal_mode=WAL");
    Execute("PRAGMA synchronous=FULL");
    Execute("PRAGMA cache_size=-32768");
    Execute("PRAGMA wal_autocheckpoint=4000");
    Execute("CREATE TABLE docs(id INTEGER PRIMARY KEY, path BLOB NOT NULL UNIQUE, m BLOB)");
    Execute("CREATE VIRTUAL TABLE ft USING fts5(name, text, tokenize='porter unicode61')");
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

  struct Document {
    explicit Document(const Json::Value& document)
        : path(document["KAVOMDPath"].asString()),
          name(document["KAVOMDFSName"].asString()),
          text(document["KAVOMDTextContent"].asString()),
          all(vexlo::JsonToString(document)) {}
    std::string path;
    std::string name;
    std::string text;
    std::string all;
  };

  void Insert(const Document& document) {
    const std::string& name = document.name;
    Bind(insert_doc_, 1, document.path);
    Bind(insert_doc_, 2, document.all);
    Step(insert_doc_);
    const int64_t id = sqlite3_last_insert_rowid(db_);
    sqlite3_bind_int64(insert_text_, 1, id);
    Bind(insert_text_, 2, name);
    Bind(insert_text_, 3, document.text);
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

  struct Answer {
    int64_t total = 0;
    int shown = 0;
  };
  Answer Ask(sqlite3_stmt* count, sqlite3_stmt* best, const std::string& match) {
    Answer answer;
    Bind(count, 1, match);
    sqlite3_step(count);
    answer.total = sqlite3_column_int64(count, 0);
    Check(sqlite3_reset(count));
    Bind(best, 1, match);
    while (sqlite3_step(best) == SQLITE_ROW) {
      answer.shown += sqlite3_column_bytes(best, 0) + sqlite3_column_bytes(best, 1) > 0 ? 1 : 0;
    }
    Check(sqlite3_reset(best));
    return answer;
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

// Sends requests[begin..end) from `clients` threads at once.
void SendAll(const EngineProcess& engine, const std::vector<std::string>& requests, size_t begin,
             size_t end, size_t clients) {
  std::atomic<size_t> next = begin;
  std::vector<std::jthread> threads;
  for (size_t i = 0; i < clients; ++i) {
    threads.emplace_back([&] {
      for (size_t at = next++; at < end; at = next++) {
        engine.SendText(requests[at]);
      }
    });
  }
}

// Documents from..to through the engine and into the bare table, in turn by parts so that a noisy
// moment meets both. Prints documents a second and the ratio; returns the engine's seconds for one.
double Upsert(const EngineProcess& engine, Bare& bare, const std::vector<Json::Value>& documents,
              size_t from, size_t to, size_t clients, size_t commit_every) {
  double ours = 0;
  double theirs = 0;
  for (size_t begin = from; begin < to; begin += commit_every) {
    const size_t end = std::min(begin + commit_every, to);
    std::vector<std::string> requests;
    std::vector<Bare::Document> bare_documents;
    for (size_t i = begin; i < end; ++i) {
      requests.push_back(vexlo::JsonToString(UpsertOf(documents[i])));
      bare_documents.emplace_back(documents[i]);
    }
    ours += Seconds([&] {
      SendAll(engine, requests, 0, requests.size(), clients);
      Send(engine, Command("commit"));
    });
    theirs += Seconds([&] {
      bare.Execute("BEGIN");
      for (const Bare::Document& document : bare_documents) {
        bare.Insert(document);
      }
      bare.Execute("COMMIT");
    });
  }
  const auto count = static_cast<double>(to - from);
  printf(
      "upsert, %zu at once, commit every %-6zu %7.0f a second %9.0f bare: %.2f times its speed\n",
      clients, commit_every, count / ours, count / theirs, theirs / ours);
  return ours / count;
}

void Query(const EngineProcess& engine, Bare& bare, const char* what, const Json::Value& data,
           const std::string& table, const std::string& match) {
  Json::Value request;
  request["command"] = "search";
  request["data"] = data;
  request["data"]["snippet"] = true;
  request["data"]["size"] = 20;
  const std::string text = vexlo::JsonToString(request);
  const std::string from = " FROM " + table + " WHERE " + table + " MATCH ?";
  sqlite3_stmt* const count = bare.Prepare(("SELECT count(*)" + from).c_str());
  sqlite3_stmt* const best =
      bare.Prepare(("SELECT (SELECT path FROM docs WHERE id = " + table + ".rowid), snippet(" +
                    table + ", -1, '<', '>', '...', 32)" + from + " ORDER BY rank LIMIT 20")
                       .c_str());
  constexpr int kTimes = 100;
  std::vector<double> ours;
  std::vector<double> theirs;
  Json::Value reply;
  Bare::Answer answer;
  for (int i = 0; i < kTimes; ++i) {
    ours.push_back(Seconds([&] { reply = engine.SendText(text); }));
    theirs.push_back(Seconds([&] { answer = bare.Ask(count, best, match); }));
  }
  printf("%-36s %9.2f ms       %9.2f bare: %.2f times its time; %u and %u of %u and %lld hits\n",
         what, Median(ours) * 1000, Median(theirs) * 1000, Median(ours) / Median(theirs),
         reply["data"].size(), static_cast<unsigned>(answer.shown), reply["total"].asUInt(),
         static_cast<long long>(answer.total));
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
  Upsert(engine, bare, documents, 0, count / 4, 1, 1000);
  const double each = Upsert(engine, bare, documents, count / 4, count / 2, 4, 1000);
  Upsert(engine, bare, documents, count / 2, count, 4, 10000);

  const std::string words = corpus.Frequent(30, 3) + " " + corpus.Frequent(60, 3);
  Query(engine, bare, "two words, with snippets", With("words", words), "ft", words);
  const std::string part = corpus.Frequent(3, 7).substr(1, 5);
  Query(engine, bare, "part of a name, 5 letters", With("name", part), "names", "\"" + part + "\"");

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
  printf("%-36s %9.2f s for %zu: %.1f times as fast as upserting them\n", "rename a folder",
         renamed, moved, each * static_cast<double>(moved) / renamed);
  Json::Value remove = Command("document_del_by_query");
  remove["data"]["query"]["qsl"]["prefix"]["KAVOMDPath"] = to + "/";
  const double removed = Seconds([&] {
    Send(engine, remove);
    Send(engine, Command("commit"));
  });
  printf("%-36s %9.2f s for %zu\n", "delete the folder", removed, moved);
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
