// What is asked about a path, beside what it would cost otherwise.
//
//   folders/N     which of N folders covers a file, over 4,096 files below folders drawn at random,
//                 at 10, 1,000 and 10,000 folders: the cost must not grow with N
//   linear/N      the same with one pass over the list, at 10 and 1,000
//   own/N         whether a path is itself a folder's
//   reindex       whether a reindex that covers a path waits in a queue of 1,000,000 lines
//   again         the first of these once more, after a line was appended; and that line
//   custom/N      1,000 custom events added one after the other to a queue of N lines, 0 or
//   1,000,000:
//                 each asks the first question, and must cost what the new lines cost
//   processing    whether anything waits below a path, in the same queue
//   simdjson      a pass over the same file, read whole, that parses each line with simdjson and
//                 takes "event" and "path" out of it
//   wc            a pass over the same file with wc -l
//
// The files are made in a folder of the program's own below the temporary folder.
// --quick runs each case for a moment, with 100,000 lines; --json prints a JSON object a line for
// each figure. Times are processor time. Otherwise all of Google Benchmark's flags.
#include <benchmark/benchmark.h>
#include <fcntl.h>
#include <json/value.h>
#include <simdjson.h>
#include <spawn.h>
#include <sys/resource.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cmath>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <map>
#include <memory>
#include <random>
#include <string>
#include <string_view>
#include <vector>

#include "common/file.h"
#include "common/json.h"
#include "common/sdk/share.h"
#include "common/string.h"
#include "figure.h"
#include "fileindex/folder_mgr.h"
#include "fileindex/paths.h"
#include "fileindex/queue_mgr.h"
#include "fileindex/util/custom_event.h"
#include "kavo/local/shares.h"

namespace {

using vexlo::fileindex::Folder;
using vexlo::fileindex::FolderMgr;
using vexlo::fileindex::QueueMgr;

constexpr size_t kPaths = 4096;
constexpr int kCustomEvents = 1000;

// What stands before every fixed path here.
const std::string& OwnRoot() {
  static const std::string root = [] {
    std::string path = std::filesystem::temp_directory_path() / "question_bench.XXXXXX";
    if (mkdtemp(path.data()) == nullptr) {
      std::perror(path.c_str());
      std::exit(1);
    }
    return path;
  }();
  return root;
}

}  // namespace

// In the place of the library's and the platform's own.
namespace vexlo::fileindex {
__attribute__((visibility("default"))) const std::string& GetFileIndexRoot() { return OwnRoot(); }
}  // namespace vexlo::fileindex
namespace kavo::local {
__attribute__((visibility("default"))) const std::string& Root() { return OwnRoot(); }
}  // namespace kavo::local

namespace {

void MakeShare() {
  std::filesystem::create_directories(OwnRoot() + "/etc/kavo");
  std::ofstream(kavo::local::SharesFile())
      << R"({"shares": [{"name": "photo", "path": "/volume1/photo"}, {"name": "own", "path": ")"
      << OwnRoot() << R"(/own"}]})";
  for (const char* const folder :
       {"/own", "/tmp", "/var/packages/Vexlo/etc", "/var/lib/kavo/fileindex/queue"}) {
    std::filesystem::create_directories(OwnRoot() + folder);
  }
}

// Folders at three depths, as an administrator would have them.
std::string FolderName(size_t i) {
  const std::string year = "/" + std::to_string(1900 + i % 120);
  const std::string album = "/album " + std::to_string(i / 3);
  return "/photo" + (i % 3 == 0 ? album : year + album + (i % 3 == 1 ? "" : "/selected"));
}

struct Asked {
  explicit Asked(size_t count) {
    Json::Value folders(Json::arrayValue);
    for (size_t i = 0; i < count; ++i) {
      Json::Value folder;
      folder["path"] = FolderName(i);
      folder["name"] = std::to_string(i);
      for (const char* const type : {"document", "audio", "video", "photo"}) {
        folder[type] = true;
      }
      folders.append(folder);
    }
    vexlo::JsonToFile(folders, vexlo::fileindex::kFileIndexFoldersCfgPath.Get());
    manager = std::make_unique<FolderMgr>();
    std::mt19937_64 random(count);
    paths.reserve(kPaths);
    for (size_t i = 0; i < kPaths; ++i) {
      paths.push_back("/volume1" + FolderName(random() % count) + "/raw/IMG_" +
                      std::to_string(random() % 100000) + ".JPG");
    }
  }

  std::unique_ptr<FolderMgr> manager;
  std::vector<std::string> paths;
};

// One iteration asks about all of the paths.
template <typename Question>
void AskAll(benchmark::State& state, size_t count, bool want, const Question& question) {
  const Asked asked(count);
  for (const std::string& path : asked.paths) {
    if ((question(*asked.manager, path) != nullptr) != want) {
      state.SkipWithError("the answer is wrong");
      return;
    }
  }
  for (auto _ : state) {
    for (const std::string& path : asked.paths) {
      benchmark::DoNotOptimize(question(*asked.manager, path));
    }
  }
}

const Folder* Covering(const FolderMgr& manager, const std::string& path) {
  return manager.GetMostSuitableCfg(path).get();
}

const FolderMgr* Own(const FolderMgr& manager, const std::string& path) {
  return manager.IsFullPathHasOwnCfg(path) ? &manager : nullptr;
}

const Folder* Linear(const FolderMgr& manager, const std::string& path) {
  const Folder* best = nullptr;
  size_t length = 0;
  for (const std::shared_ptr<Folder>& folder : manager.GetFolders()) {
    const std::string full_path = folder->GetFullPath();
    if (full_path.size() > length && vexlo::IsSameOrBelow(path, full_path)) {
      best = folder.get();
      length = full_path.size();
    }
  }
  return best;
}

void MakeQueue(const std::string& path, int64_t lines) {
  std::ofstream file(path);
  std::mt19937_64 random(2);
  for (int64_t i = 0; i < lines; ++i) {
    const uint64_t name = random() % 1'000'003;
    file << R"({"event":)" << (random() % 2 == 0 ? 8 : 4)
         << R"(,"is_dir":false,"path":"/volume1/photo/album)" << name % 97 << "/2019-"
         << name % 12 + 1 << "/IMG_" << name << R"(.JPG","path_old":"","data":null})"
         << "\n";
  }
}

// Each time of a file that nobody has asked about.
template <typename Question>
void AskQueue(benchmark::State& state, const std::string& path, Question question) {
  for (auto _ : state) {
    state.PauseTiming();
    std::filesystem::rename(path, path + ".read");
    std::filesystem::copy_file(path + ".read", path);
    std::filesystem::remove(path + ".read");
    state.ResumeTiming();
    if ((QueueMgr(path).*question)("/volume1/photo/album98")) {
      state.SkipWithError("the answer is wrong");
      return;
    }
  }
}

// What a custom event costs of a long queue: the question, and one more line.
void AskAndAppend(benchmark::State& state, const std::string& path) {
  const std::string line = R"({"data":null,"event":8,"path":"/volume1/photo/a","path_old":""})";
  for (auto _ : state) {
    if (QueueMgr(path).IsFullPathHasReindex("/volume1/photo/album98")) {
      state.SkipWithError("the answer is wrong");
      return;
    }
    vexlo::AppendLines(path, line + "\n");
  }
}

// One iteration adds all of the events to a queue that holds what the file `before` holds.
void AddEvents(benchmark::State& state, const std::string& before) {
  const std::string queue = vexlo::sdk::SDKShare("own").GetQueuePath();
  for (auto _ : state) {
    state.PauseTiming();
    std::filesystem::remove(queue);
    if (!before.empty()) {
      std::filesystem::copy_file(before, queue);
      (void)QueueMgr(queue).IsFullPathHasReindex(OwnRoot());  // The one time that it is read.
    }
    state.ResumeTiming();
    for (int i = 0; i < kCustomEvents; ++i) {
      vexlo::fileindex::AddCustomEvent(8, OwnRoot() + "/own/" + std::to_string(i), "",
                                       Json::Value());
    }
  }
  std::filesystem::remove(queue);
}

void CountLines(benchmark::State& state, const std::string& path) {
  std::string program = "wc";
  std::string option = "-l";
  std::string file = path;
  char* const arguments[] = {program.data(), option.data(), file.data(), nullptr};
  posix_spawn_file_actions_t actions;
  posix_spawn_file_actions_init(&actions);
  posix_spawn_file_actions_addopen(&actions, STDOUT_FILENO, "/dev/null", O_WRONLY, 0);
  for (auto _ : state) {
    pid_t child = 0;
    int status = 0;
    rusage used{};
    if (posix_spawnp(&child, "wc", &actions, nullptr, arguments, environ) != 0 ||
        wait4(child, &status, 0, &used) != child || status != 0) {
      state.SkipWithError("wc failed");
      break;
    }
    state.SetIterationTime(static_cast<double>(used.ru_utime.tv_sec + used.ru_stime.tv_sec) +
                           static_cast<double>(used.ru_utime.tv_usec + used.ru_stime.tv_usec) *
                               1e-6);
  }
  posix_spawn_file_actions_destroy(&actions);
}

void PassWithSimdjson(benchmark::State& state, const std::string& path) {
  for (auto _ : state) {
    const simdjson::padded_string text = simdjson::padded_string::load(path);
    simdjson::ondemand::parser parser;
    simdjson::ondemand::document_stream lines = parser.iterate_many(text);
    uint64_t sum = 0;
    for (auto line : lines) {
      sum += line["event"].get_uint64().value();
      sum += line["path"].get_string().value().size();
    }
    benchmark::DoNotOptimize(sum);
  }
}

// Keeps the fastest repetition of each run, by name.
class Figures : public benchmark::ConsoleReporter {
 public:
  explicit Figures(bool json) : json_(json) {}

  bool ReportContext(const Context& context) override {
    return json_ || ConsoleReporter::ReportContext(context);
  }

  void ReportRuns(const std::vector<Run>& runs) override {
    for (const Run& run : runs) {
      failed_ = failed_ || run.error_occurred;
      if (run.run_type == Run::RT_Iteration && !run.error_occurred) {
        // Processor time, so that what else runs on the machine does not count; `wc` tells its own.
        const double seconds = (run.run_name.function_name == "wc" ? run.real_accumulated_time
                                                                   : run.cpu_accumulated_time) /
                               static_cast<double>(run.iterations);
        auto [at, added] = seconds_.try_emplace(run.run_name.function_name, seconds);
        at->second = std::min(at->second, seconds);
      }
    }
    if (!json_) {
      ConsoleReporter::ReportRuns(runs);
    }
  }

  bool Failed() const { return failed_; }

  std::vector<bench::Figure> Table() const {
    std::vector<bench::Figure> table;
    const auto add = [&](const char* name, const char* unit, double scale, double baseline,
                         double aim) {
      table.push_back(
          {std::string("question/") + name, unit, Seconds(name) * scale, baseline * scale, aim});
    };
    for (const char* const count : {"10", "1000", "10000"}) {
      for (const char* const kind : {"folders", "own", "linear"}) {
        const std::string name = std::string(kind) + "/" + count;
        if (!std::isnan(Seconds(name))) {
          add(name.c_str(), "ns", 1e9 / kPaths, Seconds(std::string(kind) + "/10"), NAN);
        }
      }
    }
    const double passes = Seconds("simdjson") + Seconds("wc");
    add("reindex", "ms", 1e3, passes, kMostOfPasses);
    add("processing", "ms", 1e3, passes, NAN);
    add("again", "ms", 1e3, passes, NAN);
    add("simdjson", "ms", 1e3, NAN, NAN);
    add("wc", "ms", 1e3, NAN, NAN);
    add("custom/empty", "us/event", 1e6 / kCustomEvents, NAN, NAN);
    add("custom/long", "us/event", 1e6 / kCustomEvents, Seconds("custom/empty"), kMostOfEmpty);
    return table;
  }

 private:
  static constexpr double kMostOfPasses = 1.5;
  static constexpr double kMostOfEmpty = 1.3;

  // NAN for what was not run.
  double Seconds(const std::string& name) const {
    const auto found = seconds_.find(name);
    return found == seconds_.end() ? NAN : found->second;
  }

  bool json_;
  std::map<std::string, double> seconds_;
  bool failed_ = false;
};

}  // namespace

int main(int argc, char** argv) {
  const auto take = [&argc, argv](std::string_view option) {
    char** const end = argv + argc;
    char** const kept = std::remove(argv + 1, end, option);
    argc = static_cast<int>(kept - argv);
    return kept != end;
  };
  const bool quick = take("--quick");
  const bool json = take("--json");
  MakeShare();
  const std::string queue = OwnRoot() + "/queue";
  MakeQueue(queue, quick ? 100'000 : 1'000'000);
  const auto add = [quick](const std::string& name, auto run) {
    return benchmark::RegisterBenchmark(name.c_str(), run)
        ->MinTime(quick ? 0.01 : 0.2)
        ->Repetitions(quick ? 1 : 5);
  };
  for (const size_t count : {10, 1000, 10000}) {
    const std::string suffix = "/" + std::to_string(count);
    add("folders" + suffix, [=](benchmark::State& state) { AskAll(state, count, true, Covering); });
    add("own" + suffix, [=](benchmark::State& state) { AskAll(state, count, false, Own); });
    if (count <= 1000) {
      add("linear" + suffix, [=](benchmark::State& state) { AskAll(state, count, true, Linear); });
    }
  }
  add("reindex",
      [&](benchmark::State& state) { AskQueue(state, queue, &QueueMgr::IsFullPathHasReindex); });
  add("processing",
      [&](benchmark::State& state) { AskQueue(state, queue, &QueueMgr::IsFullPathProcessing); });
  add("again", [&](benchmark::State& state) { AskAndAppend(state, queue); });
  add("custom/empty", [&](benchmark::State& state) { AddEvents(state, ""); });
  add("custom/long", [&](benchmark::State& state) { AddEvents(state, queue); });
  add("wc", [&](benchmark::State& state) { CountLines(state, queue); })->UseManualTime();
  add("simdjson", [&](benchmark::State& state) { PassWithSimdjson(state, queue); });
  benchmark::Initialize(&argc, argv);
  const bool usable = !benchmark::ReportUnrecognizedArguments(argc, argv);
  Figures figures(json);
  if (usable) {
    benchmark::RunSpecifiedBenchmarks(&figures);
  }
  std::filesystem::remove_all(OwnRoot());
  if (!usable) {
    return 2;
  }
  bench::Print(figures.Table(), json);
  return figures.Failed() ? 1 : 0;
}
