// The path policy and the file types.
//
//   refused-early   a path whose first rule refuses it (a snapshot)
//   refused-late    a symbolic link, which the last rule refuses
//   accepted        a file three folders down
//   type            the group of a path's extension, beside a std::map<std::string, int> that is
//                   asked with an extension of its own string, over the same 4,096 paths
//
// 3,000 shares and the files are made up in a folder of the program's own below the temporary
// folder.
// --quick runs each case for a moment; --json prints a JSON object a line for each figure, and what
// Google Benchmark says on standard error. Otherwise all of Google Benchmark's flags.
#include <benchmark/benchmark.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <iostream>
#include <map>
#include <new>
#include <random>
#include <string>
#include <string_view>
#include <thread>
#include <vector>

#include "common/string.h"
#include "fileindex/util/file_type.h"
#include "fileindex/util/path_policy.h"
#include "kavo/local/shares.h"

namespace {

using vexlo::fileindex::CanFullPathBeIndexed;
using vexlo::fileindex::FileType;
using vexlo::fileindex::GetFileTypeByFullPath;
using vexlo::fileindex::GetFileTypeExtensions;

constexpr int kShares = 3000;
constexpr size_t kPaths = 4096;

std::atomic<uint64_t> allocations = 0;

// What stands before the platform's fixed paths here.
const std::string& OwnRoot() {
  static const std::string root = [] {
    std::string path = std::filesystem::temp_directory_path() / "policy_bench.XXXXXX";
    if (mkdtemp(path.data()) == nullptr) {
      std::perror(path.c_str());
      std::exit(1);
    }
    return path;
  }();
  return root;
}

}  // namespace

// Not inlined: the compiler would take new and free() for a mismatch.
__attribute__((noinline)) void* operator new(size_t size) {
  allocations.fetch_add(1, std::memory_order_relaxed);
  if (void* const memory = malloc(size)) {
    return memory;
  }
  throw std::bad_alloc();
}
__attribute__((noinline)) void operator delete(void* memory) noexcept { free(memory); }
__attribute__((noinline)) void operator delete(void* memory, size_t /*size*/) noexcept {
  free(memory);
}

namespace kavo::local {

// In the place of the platform's own.
__attribute__((visibility("default"))) const std::string& Root() { return OwnRoot(); }

}  // namespace kavo::local

namespace {

std::string Volume() { return std::filesystem::canonical(OwnRoot()).string() + "/volume1"; }

void MakeShares() {
  std::filesystem::create_directories(Volume() + "/photo/2019/summer");
  std::ofstream(Volume() + "/photo/2019/summer/beach.jpg") << "x";
  std::filesystem::create_symlink("beach.jpg", Volume() + "/photo/2019/summer/link.jpg");
  std::filesystem::create_directories(Volume() + "/photo/#snapshot/.snapshots");
  std::filesystem::create_directories(OwnRoot() + "/etc/kavo");
  std::ofstream file(kavo::local::SharesFile());
  file << R"({"shares": [{"name": "photo", "path": ")" << Volume() << R"(/photo"})";
  for (int i = 0; i < kShares; ++i) {
    const std::string name = "share" + std::to_string(i);
    file << R"(,)"
         << "\n"
         << R"({"name": ")" << name << R"(", "path": "/volume2/)" << name << "\"}";
  }
  file << "]}\n";
}

void Decide(benchmark::State& state, const std::string& path, bool want) {
  if (CanFullPathBeIndexed(path) != want) {
    state.SkipWithError("the decision is wrong");
    return;
  }
  for (auto _ : state) {
    benchmark::DoNotOptimize(CanFullPathBeIndexed(path));
  }
}

// Half of them with an extension of the table, the rest with others, none and in upper case.
std::vector<std::string> MakePaths() {
  const auto documents = GetFileTypeExtensions(vexlo::fileindex::FILE_TYPE_DOCUMENT);
  std::mt19937_64 random(1);
  std::vector<std::string> paths;
  for (size_t i = 0; i < kPaths; ++i) {
    std::string path = "/volume1/photo/2019/summer/file" + std::to_string(random() % 100000);
    const std::string_view known = documents[random() % documents.size()];
    switch (random() % 8) {
      case 0:
        break;
      case 1:
        path += ".unknown";
        break;
      case 2:
        path += ".JPG";
        break;
      case 3:
        path += ".mp4";
        break;
      default:
        path += "." + std::string(known);
    }
    paths.push_back(path);
  }
  return paths;
}

std::map<std::string, int> MakeMap() {
  std::map<std::string, int> map;
  for (int type = 0; type < 4; ++type) {
    for (const std::string_view extension : GetFileTypeExtensions(static_cast<FileType>(type))) {
      map.emplace(extension, type);
    }
  }
  return map;
}

// One iteration looks up all of the paths.
template <typename LookUp>
void LookUpAll(benchmark::State& state, const std::vector<std::string>& texts,
               const LookUp& look_up) {
  uint64_t allocated = 0;
  for (auto _ : state) {
    const uint64_t before = allocations;
    int64_t sum = 0;
    for (const std::string& text : texts) {
      sum += look_up(text);
    }
    benchmark::DoNotOptimize(sum);
    allocated += allocations - before;
  }
  state.counters["allocations"] =
      static_cast<double>(allocated) / static_cast<double>(state.iterations() * kPaths);
}

// Keeps the fastest repetition of each run, by name, and its allocations.
class Figures : public benchmark::ConsoleReporter {
 public:
  void ReportRuns(const std::vector<Run>& runs) override {
    for (const Run& run : runs) {
      failed_ = failed_ || run.error_occurred;
      if (run.run_type == Run::RT_Iteration && !run.error_occurred) {
        const double seconds = run.real_accumulated_time / static_cast<double>(run.iterations);
        auto [at, added] = seconds_.try_emplace(run.run_name.function_name, seconds);
        at->second = std::min(at->second, seconds);
        if (const auto counter = run.counters.find("allocations"); counter != run.counters.end()) {
          allocations_[run.run_name.function_name] = counter->second;
        }
      }
    }
    ConsoleReporter::ReportRuns(runs);
  }

  // 0 for what was not run.
  double Seconds(const std::string& name) const {
    const auto found = seconds_.find(name);
    return found == seconds_.end() ? 0 : found->second;
  }

  // Nanoseconds a question or a look-up.
  bool PrintJson() const {
    for (const char* const name : {"refused-early", "refused-late", "accepted"}) {
      std::printf(R"({"case":"policy: %s","value":%.1f,"unit":"ns","baseline":null,"ratio":null,)"
                  R"("aim":null,"met":null})"
                  "\n",
                  name, 1e9 * Seconds(name));
    }
    const double ours = 1e9 * Seconds("type") / static_cast<double>(kPaths);
    for (const char* const name : {"map", "map-find-only"}) {
      const double baseline = 1e9 * Seconds(name) / static_cast<double>(kPaths);
      std::printf(R"({"case":"file type, beside %s","value":%.2f,"unit":"ns","baseline":%.2f,)"
                  R"("ratio":%.3f,"aim":null,"met":null})"
                  "\n",
                  name, ours, baseline, ours / baseline);
    }
    return !failed_;
  }

  bool Print() const {
    std::printf("\n%-16s %14s\n", "", "decisions/s");
    for (const char* const name : {"refused-early", "refused-late", "accepted"}) {
      std::printf("%-16s %14.0f\n", name, 1 / Seconds(name));
    }
    std::printf("\n%-16s %14s %8s %14s\n", "", "look-ups/s", "ratio", "allocations");
    for (const char* const name : {"type", "map", "map-find-only"}) {
      const auto allocated = allocations_.find(name);
      std::printf("%-16s %14.0f %8.1f %14.3f\n", name, static_cast<double>(kPaths) / Seconds(name),
                  Seconds(name) / Seconds("type"),
                  allocated == allocations_.end() ? 0 : allocated->second);
    }
    return !failed_;
  }

 private:
  std::map<std::string, double> seconds_;
  std::map<std::string, double> allocations_;
  bool failed_ = false;
};

}  // namespace

int main(int argc, char** argv) {
  const auto take = [&](std::string_view option) {
    char** const at = std::find(argv + 1, argv + argc, option);
    if (at == argv + argc) {
      return false;
    }
    std::rotate(at, at + 1, argv + argc + 1);
    --argc;
    return true;
  };
  const bool quick = take("--quick");
  const bool json = take("--json");
  MakeShares();
  // A file that has just been written is read anew for each question.
  std::this_thread::sleep_for(std::chrono::milliseconds(2100));
  const std::string photo = Volume() + "/photo";
  const std::vector<std::string> paths = MakePaths();
  std::vector<std::string> extensions;
  extensions.reserve(paths.size());
  for (const std::string& path : paths) {
    extensions.push_back(vexlo::GetFileExtension(path, /*lower=*/true));
  }
  const std::map<std::string, int> map = MakeMap();
  const auto find = [&map](const std::string& extension) {
    const auto found = map.find(extension);
    return found == map.end() ? 4 : found->second;
  };
  const auto add = [quick](const char* name, auto run) {
    benchmark::RegisterBenchmark(name, run)
        ->MinTime(quick ? 0.01 : 0.3)
        ->Repetitions(quick ? 1 : 3);
  };
  add("refused-early",
      [&](benchmark::State& state) { Decide(state, photo + "/#snapshot/.snapshots", false); });
  add("refused-late",
      [&](benchmark::State& state) { Decide(state, photo + "/2019/summer/link.jpg", false); });
  add("accepted",
      [&](benchmark::State& state) { Decide(state, photo + "/2019/summer/beach.jpg", true); });
  add("type", [&](benchmark::State& state) {
    LookUpAll(state, paths, [](const std::string& path) { return GetFileTypeByFullPath(path); });
  });
  // What the table replaces, and the part of it that is the map's alone.
  add("map", [&](benchmark::State& state) {
    LookUpAll(state, paths, [&find](const std::string& path) {
      return find(vexlo::GetFileExtension(path, /*lower=*/true));
    });
  });
  add("map-find-only", [&](benchmark::State& state) { LookUpAll(state, extensions, find); });
  benchmark::Initialize(&argc, argv);
  const bool usable = !benchmark::ReportUnrecognizedArguments(argc, argv);
  Figures figures;
  if (json) {
    figures.SetOutputStream(&std::cerr);
  }
  if (usable) {
    benchmark::RunSpecifiedBenchmarks(&figures);
  }
  std::filesystem::remove_all(OwnRoot());
  if (!usable) {
    return 2;
  }
  return (json ? figures.PrintJson() : figures.Print()) ? 0 : 1;
}
