// From an open queue file to delivered operations, beside a baseline that only reads the same lines
// and parses each with jsoncpp. Every case is run at two sizes: what a line costs must not grow
// with the queue.
//
//   skewed        a twentieth as many files as lines, a few of them busy (Zipf), 12 folders each
//   wide          one folder, a fifth as many files as lines, in five passes
//   deep          files 40 levels down, four lines each
//   folder-rename folders of 10,000 new files, each renamed ten times
//   save-rename   one file saved over and over: create beside, write, rename over
//
// --quick runs the small size only, once. Otherwise all of Google Benchmark's flags.
#include <benchmark/benchmark.h>
#include <json/reader.h>
#include <unistd.h>

#include <algorithm>
#include <cmath>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <fstream>
#include <functional>
#include <iostream>
#include <map>
#include <memory>
#include <random>
#include <string>
#include <string_view>
#include <vector>

#include "fileindex/optree/optree.h"

namespace {

using vexlo::fileindex::OP;
using vexlo::fileindex::OPTree;

constexpr int64_t kSmall = 10'000;
constexpr int64_t kLarge = 1'000'000;

std::string Line(uint32_t event, const std::string& path, const std::string& path_old = "") {
  return "{\"event\":" + std::to_string(event) + ",\"is_dir\":false,\"path\":\"" + path +
         "\",\"path_old\":\"" + path_old + "\",\"data\":null}\n";
}

std::string FolderLine(uint32_t event, const std::string& path, const std::string& path_old) {
  return "{\"event\":" + std::to_string(event) + ",\"is_dir\":true,\"path\":\"" + path +
         "\",\"path_old\":\"" + path_old + "\",\"data\":null}\n";
}

using Sink = std::function<void(const std::string&)>;

void Skewed(int64_t lines, const Sink& sink) {
  const int64_t files = lines / 20;
  std::mt19937_64 random(1);
  std::vector<double> weights(static_cast<size_t>(files));
  for (size_t i = 0; i < weights.size(); ++i) {
    weights[i] = 1.0 / static_cast<double>(i + 1);
  }
  std::discrete_distribution<int64_t> file_of(weights.begin(), weights.end());
  constexpr uint32_t kEvents[] = {8, 8, 8, 8, 8, 4, 4, 4, 0x40, 0x80};
  for (int64_t i = 0; i < lines; ++i) {
    // Scattered over the folders, so that busy files do not share one.
    const uint64_t file = static_cast<uint64_t>(file_of(random)) * 2654435761U % 1'000'003U;
    sink(Line(kEvents[random() % std::size(kEvents)],
              "/volume1/photo/album" + std::to_string(file % 97) + "/2019-" +
                  std::to_string(file % 12 + 1) + "/IMG_" + std::to_string(file) + ".JPG"));
  }
}

void Wide(int64_t lines, const Sink& sink) {
  constexpr uint32_t kPasses[] = {0x40, 8, 4, 8, 4};
  const int64_t files = lines / 5;
  for (const uint32_t event : kPasses) {
    for (int64_t file = 0; file < files; ++file) {
      sink(Line(event, "/volume1/mail/archive/message-" + std::to_string(file * 7919 % files)));
    }
  }
}

void Deep(int64_t lines, const Sink& sink) {
  std::string folder = "/volume1/src";
  for (int level = 0; level < 36; ++level) {
    folder += "/dir-" + std::to_string(level);
  }
  constexpr uint32_t kEvents[] = {0x40, 8, 4, 8};
  for (int64_t i = 0; i < lines; ++i) {
    const int64_t file = i / 4;
    sink(Line(kEvents[i % 4], folder + "/sub-" + std::to_string(file / 100) + "/file-" +
                                  std::to_string(file % 100)));
  }
}

void FolderRename(int64_t lines, const Sink& sink) {
  constexpr int64_t kFiles = 10'000;
  constexpr int64_t kRenames = 10;
  for (int64_t i = 0; i < lines; ++i) {
    const int64_t step = i % (kFiles + kRenames);
    const std::string folder =
        "/volume1/projects/job-" + std::to_string(i / (kFiles + kRenames)) + "-";
    if (step < kFiles) {
      sink(Line(0x40, folder + "0/part-" + std::to_string(step)));
    } else {
      sink(FolderLine(0x100, folder + std::to_string(step - kFiles + 1),
                      folder + std::to_string(step - kFiles)));
    }
  }
}

void SaveRename(int64_t lines, const Sink& sink) {
  const std::string file = "/volume1/home/notes/diary.txt";
  for (int64_t i = 0; i < lines; ++i) {
    switch (i % 3) {
      case 0:
        sink(Line(0x40, file + "~"));
        break;
      case 1:
        sink(Line(8, file + "~"));
        break;
      default:
        sink(Line(0x100, file, file + "~"));
        break;
    }
  }
}

struct Case {
  const char* name;
  void (*write)(int64_t, const Sink&);
};
constexpr Case kCases[] = {{"skewed", Skewed},
                           {"wide", Wide},
                           {"deep", Deep},
                           {"folder-rename", FolderRename},
                           {"save-rename", SaveRename}};

// The queue files, made at first use and removed at the end.
class Queues {
 public:
  Queues() {
    const char* const base = getenv("TMPDIR");
    folder_ = std::string(base == nullptr ? "/tmp" : base) + "/pipeline_bench.XXXXXX";
    if (mkdtemp(folder_.data()) == nullptr) {
      perror("mkdtemp");
      exit(3);
    }
  }
  ~Queues() {
    for (const auto& [name, path] : paths_) {
      unlink(path.c_str());
    }
    rmdir(folder_.c_str());
  }
  Queues(const Queues&) = delete;
  Queues& operator=(const Queues&) = delete;

  const std::string& Path(const Case& queue_case, int64_t lines) {
    std::string& path = paths_[std::string(queue_case.name) + "." + std::to_string(lines)];
    if (path.empty()) {
      path = folder_ + "/" + queue_case.name + "." + std::to_string(lines);
      std::ofstream out(path);
      queue_case.write(lines, [&out](const std::string& line) { out << line; });
    }
    return path;
  }

 private:
  std::string folder_;
  std::map<std::string, std::string> paths_;
};

Queues& TheQueues() {
  static Queues queues;
  return queues;
}

void Ours(benchmark::State& state, const Case& queue_case, int64_t lines) {
  const std::string& path = TheQueues().Path(queue_case, lines);
  while (state.KeepRunning()) {
    OPTree tree(path);
    size_t delivered = 0;
    tree.ProcessOP([&delivered](const std::shared_ptr<OP>&) { ++delivered; });
    if (tree.GetLineCount() != static_cast<uint64_t>(lines) || tree.GetSkippedCount() != 0) {
      state.SkipWithError("lines were lost");
    }
    state.counters["delivered"] = static_cast<double>(delivered);
  }
}

void Baseline(benchmark::State& state, const Case& queue_case, int64_t lines) {
  const std::string& path = TheQueues().Path(queue_case, lines);
  Json::CharReaderBuilder builder;
  builder["collectComments"] = false;
  const std::unique_ptr<Json::CharReader> reader(builder.newCharReader());
  while (state.KeepRunning()) {
    std::ifstream in(path);
    std::string line;
    int64_t parsed = 0;
    while (std::getline(in, line)) {
      Json::Value value;
      parsed += reader->parse(line.data(), line.data() + line.size(), &value, nullptr) ? 1 : 0;
      benchmark::DoNotOptimize(value);
    }
    if (parsed != lines) {
      state.SkipWithError("lines were lost");
    }
  }
}

// Keeps the fastest repetition of each run, by name.
class Figures : public benchmark::ConsoleReporter {
 public:
  void ReportRuns(const std::vector<Run>& runs) override {
    for (const Run& run : runs) {
      if (run.run_type == Run::RT_Iteration && !run.error_occurred) {
        const double seconds = run.real_accumulated_time / static_cast<double>(run.iterations);
        auto [at, added] = seconds_.try_emplace(run.run_name.function_name, seconds);
        at->second = std::min(at->second, seconds);
      }
      failed_ = failed_ || run.error_occurred;
    }
    ConsoleReporter::ReportRuns(runs);
  }

  bool Failed() const { return failed_; }

  // Nanoseconds a line, NaN for what was not run.
  double PerLine(const std::string& name, int64_t lines) const {
    const auto found = seconds_.find(name);
    return found == seconds_.end() ? NAN : found->second * 1e9 / static_cast<double>(lines);
  }

 private:
  std::map<std::string, double> seconds_;
  bool failed_ = false;
};

std::string NameOf(const char* who, const char* queue_case, int64_t lines) {
  return std::string(who) + "/" + queue_case + "/" + std::to_string(lines);
}

void PrintTable(const Figures& figures) {
  std::printf("\n%-14s %12s %12s %8s %12s %8s\n", "ns a line", "10,000", "1,000,000", "growth",
              "jsoncpp", "ratio");
  for (const Case& queue_case : kCases) {
    const double small = figures.PerLine(NameOf("fold", queue_case.name, kSmall), kSmall);
    const double large = figures.PerLine(NameOf("fold", queue_case.name, kLarge), kLarge);
    double baseline = figures.PerLine(NameOf("jsoncpp", queue_case.name, kLarge), kLarge);
    double ours = large;
    if (std::isnan(large)) {
      baseline = figures.PerLine(NameOf("jsoncpp", queue_case.name, kSmall), kSmall);
      ours = small;
    }
    std::printf("%-14s %12.0f %12.0f %8.2f %12.0f %8.3f\n", queue_case.name, small, large,
                large / small, baseline, ours / baseline);
  }
}

}  // namespace

int main(int argc, char** argv) {
  const bool quick = argc > 1 && std::string_view(argv[1]) == "--quick";
  if (quick) {
    --argc;
    std::rotate(argv + 1, argv + 2, argv + argc + 1);
  }
  const std::vector<int64_t> sizes = quick ? std::vector{kSmall} : std::vector{kSmall, kLarge};
  for (const Case& queue_case : kCases) {
    for (const int64_t lines : sizes) {
      for (const auto& [who, run] : {std::pair{"fold", &Ours}, std::pair{"jsoncpp", &Baseline}}) {
        auto* const registered = benchmark::RegisterBenchmark(
            NameOf(who, queue_case.name, lines).c_str(), run, queue_case, lines);
        registered->Unit(benchmark::kMillisecond)
            ->MinTime(quick ? 0.01 : 0.3)
            ->Repetitions(quick ? 1 : 3);
      }
    }
  }
  benchmark::Initialize(&argc, argv);
  if (benchmark::ReportUnrecognizedArguments(argc, argv)) {
    return 2;
  }
  Figures figures;
  benchmark::RunSpecifiedBenchmarks(&figures);
  PrintTable(figures);
  return figures.Failed() ? 1 : 0;
}
