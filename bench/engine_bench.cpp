// The search engine behind its socket, in a process of its own, beside programs without a socket,
// JSON or a second process that do the same on SQLite, in the same run. The corpus is seeded: a
// third of the documents has 1.5 KB of text; names hold ideographs and raw bytes; paths go up to
// 1,000 bytes.
//
//   upsert   one request and one connection a document, as the library sends them, from one client
//            thread and from four, as an indexer with several workers does; a commit every 1,000
//            and every 10,000. The texts of the requests are made before; sending them and reading
//            the replies counts, on the same processors as the engine's work.
//   search   two frequent words, and a part of a name; the number of all hits, and the best 20 with
//            snippets; connecting, and parsing the reply, count
//   rename   a folder of 10,000 documents, as one compound of partial updates
//   delete   the same folder by the beginning of its paths
//   crawl    another index with text files of 1 to 4 KB, whose words are as frequent as in a
//            language, in compounds of 64 from three clients, a commit every 4,000; then the
//            size of the index at rest; then a quarter of them once more with other texts
//   tree     a third index with a folder of files without text, renamed as the library does it: a
//            query for a page of 10,000 paths, a compound that moves them, a commit, until none is
//            left; the client's JSON counts
//   memory   the highest proportional set size of the engine's process, looked at after each part
//
// There are two baselines; both run prepared statements on one connection, with write-ahead log,
// full synchronisation, pages and caches as the engine has them.
//   same     fills the same tables with the same rows, cut by the same tokenizers. What is in the
//            rows is found out before; packing the long texts counts.
//   simple   A document is a row of its path, which is unique, and itself as JSON; its text and
//   name
//            in an FTS5 table (porter, unicode61; it keeps their texts, for the snippets); and its
//            name in an FTS5 table of trigrams. Its queries count the hits, then read the best 20
//            by bm25 with path and snippet; in the order of "rank", so that only those 20 get a
//            snippet. It does less than the engine: it looks for no document to replace, checks no
//            value, stems no second form of a word, has no parts of two letters, and keeps no
//            values to look documents up or filter them by.
//
// --quick makes 2,000 documents instead of 100,000, and 5,000 in the tree. --documents=N and
// --tree=N make N. --json prints a JSON object a line: case, value, unit, baseline, ratio, aim (of
// the ratio where there is a baseline, else of the value), met.
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
#include <fstream>
#include <functional>
#include <limits>
#include <memory>
#include <optional>
#include <random>
#include <string>
#include <string_view>
#include <thread>
#include <vector>

#include "bench/same_tables.h"
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

// One line for each case.
class Report {
 public:
  explicit Report(bool json) : json_(json) {}

  enum class Aim { kNone, kAtLeast, kAtMost };
  struct Line {
    std::string name;
    double value;
    const char* unit;
    std::optional<double> baseline = {};
    Aim aim = Aim::kNone;
    double wanted = 0;
  };

  // The ratio is the value through the baseline.
  void Print(const Line& line) const {
    const double judged = line.baseline ? line.value / *line.baseline : line.value;
    const bool met = line.aim == Aim::kAtLeast ? judged >= line.wanted : judged <= line.wanted;
    if (!json_) {
      printf("%-46s %11.2f %s", line.name.c_str(), line.value, line.unit);
      if (line.baseline) {
        printf(", baseline %.2f, ratio %.2f", *line.baseline, judged);
      }
      if (line.aim != Aim::kNone) {
        printf(", aim %s %g%s", line.aim == Aim::kAtLeast ? ">=" : "<=", line.wanted,
               met ? "" : ": missed");
      }
      puts("");
      return;
    }
    Json::Value out;
    out["case"] = line.name;
    out["value"] = line.value;
    out["unit"] = line.unit;
    out["baseline"] = line.baseline ? Json::Value(*line.baseline) : Json::Value();
    out["ratio"] = line.baseline ? Json::Value(judged) : Json::Value();
    out["aim"] = line.aim != Aim::kNone ? Json::Value(line.wanted) : Json::Value();
    out["met"] = line.aim != Aim::kNone ? Json::Value(met) : Json::Value();
    puts(vexlo::JsonToString(out).c_str());
  }

 private:
  bool json_;
};

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

  // The memory of the process with its part of what is shared, in MiB.
  double Pss() const {
    std::ifstream file("/proc/" + std::to_string(pid_) + "/smaps_rollup");
    for (std::string word; file >> word;) {
      if (double kilobytes = 0; word == "Pss:" && file >> kilobytes) {
        return kilobytes / 1024;
      }
    }
    return std::numeric_limits<double>::infinity();
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
    const std::jthread idler([&engine](const std::stop_token& stop) {
      while (!stop.stop_requested()) {
        std::this_thread::sleep_for(std::chrono::seconds(1));
        engine.CommitIdle(std::chrono::seconds(5));
      }
    });
    const int never = eventfd(0, EFD_CLOEXEC);
    _exit(told && server.Run(never) ? 0 : 1);
  }

  std::string socket_;
  pid_t pid_ = -1;
};

Json::Value Send(const EngineProcess& engine, const Json::Value& request) {
  return engine.Send(request);
}

Json::Value Command(const std::string& command, const std::string& id = "bench") {
  Json::Value request;
  request["command"] = command;
  request["data"]["id"] = id;
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
    Json::Value data = File(parent, name);
    if (i % 3 == 0) {
      std::string text;
      while (text.size() < 1500) {
        text += Word() + " ";
      }
      data["KAVOMDTextContent"] = text;
    }
    return data;
  }

  // A text file of 1 to 4 KB; words as frequent as one through their rank. The same number gives
  // the same path and another text each time.
  Json::Value TextFile(size_t i) {
    const std::string name = words_[i % 20000] + "-" + std::to_string(i) + ".txt";
    const std::string parent = "/volume1/text/" + words_[i % 400] + std::to_string(i % 400);
    Json::Value data = File(parent, name);
    const size_t size = 1000 + random_() % 3000;
    std::string text;
    while (text.size() < size) {
      text += RankedWord();
      text += ' ';
    }
    data["KAVOMDTextContent"] = text;
    return data;
  }

  // A file without text.
  Json::Value File(const std::string& parent, const std::string& name) {
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
    return data;
  }

 private:
  // One of 20,000.
  const std::string& RankedWord() {
    if (sums_.empty()) {
      double sum = 0;
      for (int rank = 0; rank < 20000; ++rank) {
        sums_.push_back(sum += 1.0 / (rank + 10));
      }
    }
    const double at = sums_.back() * (static_cast<double>(random_() % 1000000007) / 1000000007.0);
    const auto found = std::upper_bound(sums_.begin(), sums_.end() - 1, at);
    return words_[static_cast<size_t>(found - sums_.begin())];
  }

  std::mt19937_64 random_{1};
  std::vector<std::string> words_;
  std::vector<double> sums_;
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

// The simple baseline.
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

// Inserts documents into a baseline in one transaction.
template <typename Baseline>
double InsertAll(Baseline& baseline, const std::vector<typename Baseline::Document>& documents) {
  return Seconds([&] {
    baseline.Execute("BEGIN");
    for (const auto& document : documents) {
      baseline.Insert(document);
    }
    baseline.Execute("COMMIT");
  });
}

// Documents from..to through the engine and into the baselines, in turn by parts so that a noisy
// moment meets all. Returns the engine's seconds for one.
double Upsert(const Report& report, const EngineProcess& engine, bench::SameTables& same,
              Bare& bare, const std::vector<Json::Value>& documents, size_t from, size_t to,
              size_t clients, size_t commit_every) {
  double ours = 0;
  double same_tables = 0;
  double simple = 0;
  for (size_t begin = from; begin < to; begin += commit_every) {
    const size_t end = std::min(begin + commit_every, to);
    std::vector<std::string> requests;
    std::vector<bench::SameTables::Document> rows;
    std::vector<Bare::Document> bare_documents;
    for (size_t i = begin; i < end; ++i) {
      requests.push_back(vexlo::JsonToString(UpsertOf(documents[i])));
      rows.push_back(same.Rows(documents[i]));
      bare_documents.emplace_back(documents[i]);
    }
    ours += Seconds([&] {
      SendAll(engine, requests, 0, requests.size(), clients);
      Send(engine, Command("commit"));
    });
    same_tables += InsertAll(same, rows);
    simple += InsertAll(bare, bare_documents);
  }
  const auto count = static_cast<double>(to - from);
  const std::string name = "upsert, " + std::to_string(clients) + " at once, commit every " +
                           std::to_string(commit_every);
  report.Print({name, count / ours, "1/s", count / same_tables, Report::Aim::kAtLeast, 0.6});
  report.Print(
      {name + ", simple", count / ours, "1/s", count / simple, Report::Aim::kAtLeast, 0.5});
  return ours / count;
}

void Query(const Report& report, const EngineProcess& engine, Bare& bare, const char* what,
           const Json::Value& data, const std::string& table, const std::string& match) {
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
  if (reply["total"].asInt64() != answer.total ||
      static_cast<int>(reply["data"].size()) != answer.shown) {
    fprintf(stderr, "%s: %lld hits, and %lld in the baseline\n", what,
            static_cast<long long>(reply["total"].asInt64()), static_cast<long long>(answer.total));
    exit(1);
  }
  report.Print({what, Median(ours) * 1000, "ms", Median(theirs) * 1000, Report::Aim::kAtMost, 1.5});
}

Json::Value With(const char* key, const Json::Value& value) {
  Json::Value data;
  data[key] = value;
  return data;
}

void CreateIndex(const EngineProcess& engine, const std::string& id, const std::string& folder) {
  Json::Value create = Command("index_create", id);
  create["data"]["path"] = folder + "/" + id;
  create["data"]["mappings"] = vexlo::fileindex::elastic::GetFileIndexMappings();
  Send(engine, create);
}

// The seconds for all documents, as compounds of 64 from three clients.
double Crawl(const EngineProcess& engine, const std::vector<Json::Value>& documents,
             const std::string& id) {
  std::vector<std::string> requests;
  double seconds = 0;
  const auto send = [&] {
    seconds += Seconds([&] {
      SendAll(engine, requests, 0, requests.size(), 3);
      Send(engine, Command("commit", id));
    });
    requests.clear();
  };
  for (size_t from = 0; from < documents.size(); from += 64) {
    Json::Value compound;
    for (size_t i = from; i < std::min(from + 64, documents.size()); ++i) {
      Json::Value item = UpsertOf(documents[i]);
      item["data"]["id"] = id;
      compound["compound"].append(std::move(item));
    }
    requests.push_back(vexlo::JsonToString(compound));
    if (requests.size() == 63) {
      send();
    }
  }
  send();
  return seconds;
}

double BytesBelow(const std::string& folder) {
  double bytes = 0;
  for (const auto& entry : std::filesystem::directory_iterator(folder)) {
    bytes += static_cast<double>(entry.file_size());
  }
  return bytes;
}

void CrawlCases(const Report& report, const EngineProcess& engine, size_t count,
                const std::string& folder, double* memory) {
  CreateIndex(engine, "text", folder);
  Corpus corpus;
  std::vector<Json::Value> documents;
  documents.reserve(count);
  double bytes = 0;
  for (size_t i = 0; i < count; ++i) {
    documents.push_back(corpus.TextFile(i));
    bytes += static_cast<double>(documents[i]["KAVOMDTextContent"].asString().size());
  }
  const double added = Crawl(engine, documents, "text") / static_cast<double>(count);
  *memory = std::max(*memory, engine.Pss());
  // At rest once the log is empty.
  for (int waits = 0; waits < 1200; ++waits) {
    std::this_thread::sleep_for(std::chrono::milliseconds(100));
    if (std::filesystem::file_size(folder + "/text/index.db-wal") == 0) {
      break;
    }
  }
  const double size = BytesBelow(folder + "/text");
  report.Print({"size of the index, beside the texts", size / 1e6, "MB", bytes / 1e6,
                Report::Aim::kAtMost, 2.0});
  std::vector<Json::Value> changed;
  for (size_t i = 1; i < count; i += 4) {
    changed.push_back(corpus.TextFile(i));
  }
  // As they come, and not in the order of the index.
  std::shuffle(changed.begin(), changed.end(), std::mt19937_64(2));
  const double again = Crawl(engine, changed, "text") / static_cast<double>(changed.size());
  *memory = std::max(*memory, engine.Pss());
  report.Print({"a changed text of 1 to 4 KB, beside a new one", again * 1e6, "us", added * 1e6,
                Report::Aim::kAtMost, 1.5});
}

// As the library does it.
void RenameTree(const EngineProcess& engine, const std::string& id, const std::string& from,
                const std::string& to) {
  Json::Value query = Command("document_get_by_query", id);
  query["data"]["query"]["qsl"]["prefix"]["KAVOMDPath"] = from + "/";
  for (const char* field : {"KAVOMDPath", "KAVOMDFSName", "KAVOMDParent"}) {
    query["data"]["query"]["load_field"].append(field);
  }
  query["data"]["query"]["size"] = 10000;
  for (Json::ArrayIndex count = 10000; count == 10000;) {
    const Json::Value hits = Send(engine, query)["data"];
    count = hits.size();
    Json::Value request;
    request["compound"] = Json::arrayValue;
    for (const Json::Value& hit : hits) {
      Json::Value item = Rename(hit, from, to);
      item["data"]["id"] = id;
      request["compound"].append(std::move(item));
    }
    Send(engine, request);
    Send(engine, Command("commit", id));
  }
}

void TreeCases(const Report& report, const EngineProcess& engine, size_t count,
               const std::string& folder, double* memory) {
  CreateIndex(engine, "tree", folder);
  Corpus corpus;
  std::vector<Json::Value> documents;
  for (size_t i = 0; i < count; ++i) {
    documents.push_back(corpus.File("/volume1/tree/folder " + std::to_string(i / 100),
                                    corpus.Word() + std::to_string(i) + ".jpg"));
    if (documents.size() == 4000) {
      Crawl(engine, documents, "tree");
      documents.clear();
    }
  }
  Crawl(engine, documents, "tree");
  const double seconds =
      Seconds([&] { RenameTree(engine, "tree", "/volume1/tree", "/volume1/another place"); });
  *memory = std::max(*memory, engine.Pss());
  // Two seconds for each 100,000, and a little more for a million.
  const bool judged = count == 100000 || count == 1000000;
  report.Print({"rename a tree of " + std::to_string(count) + ", with the client", seconds, "s",
                std::nullopt, judged ? Report::Aim::kAtMost : Report::Aim::kNone,
                count == 1000000 ? 25.0 : 2.0});
}

void Run(const Report& report, size_t count, size_t tree, const std::string& folder) {
  const EngineProcess engine(folder);  // Before anything here has threads.
  CreateIndex(engine, "bench", folder);
  bench::SameTables same(folder);
  Bare bare(folder);

  Corpus corpus;
  std::vector<Json::Value> documents;
  documents.reserve(count);
  for (size_t i = 0; i < count; ++i) {
    documents.push_back(corpus.Document(i));
  }
  Upsert(report, engine, same, bare, documents, 0, count / 4, 1, 1000);
  const double each = Upsert(report, engine, same, bare, documents, count / 4, count / 2, 4, 1000);
  Upsert(report, engine, same, bare, documents, count / 2, count, 4, 10000);
  double memory = engine.Pss();

  const std::string words = corpus.Frequent(30, 3) + " " + corpus.Frequent(60, 3);
  Query(report, engine, bare, "two words, with snippets", With("words", words), "ft", words);
  const std::string part = corpus.Frequent(3, 7).substr(1, 5);
  Query(report, engine, bare, "part of a name, 5 letters", With("name", part), "names",
        "\"" + part + "\"");

  const size_t moved = std::min<size_t>(count, 10000);
  const std::string from = "/volume1/share/folder0";
  const std::string to = "/volume1/share/renamed folder";
  Json::Value rename;
  for (size_t i = 0; i < moved; ++i) {
    rename["compound"].append(Rename(documents[i], from, to));
  }
  documents.clear();
  const double renamed = Seconds([&] {
    Send(engine, rename);
    Send(engine, Command("commit"));
  });
  const auto items = static_cast<double>(moved);
  report.Print({"rename a folder, beside upserting it", items / renamed, "1/s", 1 / each,
                Report::Aim::kAtLeast, 10});
  Json::Value remove = Command("document_del_by_query");
  remove["data"]["query"]["qsl"]["prefix"]["KAVOMDPath"] = to + "/";
  const double removed = Seconds([&] {
    Send(engine, remove);
    Send(engine, Command("commit"));
  });
  memory = std::max(memory, engine.Pss());
  report.Print({"delete a folder of " + std::to_string(moved), removed, "s", std::nullopt,
                Report::Aim::kAtMost, 0.35});
  CrawlCases(report, engine, std::max<size_t>(count / 5, 2000), folder, &memory);
  report.Print({"memory in a crawl", memory, "MiB", std::nullopt, Report::Aim::kAtMost, 150});
  TreeCases(report, engine, tree, folder, &memory);
  report.Print({"memory in all", memory, "MiB", std::nullopt, Report::Aim::kAtMost, 200});
}

}  // namespace

int main(int argc, char** argv) {
  setlinebuf(stdout);  // Each line as it is known, also to a pipe.
  size_t documents = 100000;
  size_t tree = 100000;
  bool json = false;
  for (int i = 1; i < argc; ++i) {
    const std::string_view argument = argv[i];
    if (argument == "--quick") {
      documents = 2000;
      tree = 5000;
    } else if (argument.starts_with("--documents=")) {
      documents = strtoul(argv[i] + 12, nullptr, 10);
    } else if (argument.starts_with("--tree=")) {
      tree = strtoul(argv[i] + 7, nullptr, 10);
    } else if (argument == "--json") {
      json = true;
    }
  }
  std::string folder = "/tmp/engine-bench.XXXXXX";
  if (mkdtemp(folder.data()) == nullptr) {
    perror("mkdtemp");
    return 1;
  }
  Run(Report(json), documents, tree, folder);
  std::filesystem::remove_all(folder);
  return 0;
}
