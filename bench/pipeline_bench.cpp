// From an open queue file to delivered operations, beside a baseline that only reads the same lines
// and parses each with jsoncpp. Every case is run at several sizes: what a line costs must not grow
// with the queue.
//
//   skewed        a twentieth as many files as lines, a few of them busy (Zipf), 12 folders each
//   skewed-fixed  the same with 50,000 files, however many lines there are
//   wide          one folder, a fifth as many files as lines, in five passes
//   deep          files 40 levels down, four lines each
//   folder-rename folders of 10,000 new files, each renamed ten times
//   save-rename   one file saved over and over: create beside, write, rename over
//   children      one folder of as many new files as lines
//   renames       a folder of 100,000 new files, renamed 1,000 times
//   reindex       one path 36 levels down, reindexed over and over
//
// memory/NAME is the heap that the built tree holds for each distinct path with a pending
// operation: `wide` and `deep` as above, `folders` with 200,000 new files in 997 folders.
//
// Times are processor time, the least of several passes that take turns with the baseline's, so
// that what else runs on the machine counts for both. The baseline reads the case's queue of up to
// 1,000,000 lines; of 10,000,000 lines it is our own figure at 1,000,000.
//
//   --quick  fewer passes, a shorter baseline, and nothing above 1,000,000 lines
//   --json   a JSON object a line for each figure instead of the table
//   NAME     the cases of that name alone
#include <json/reader.h>
#include <malloc.h>
#include <unistd.h>

#include <algorithm>
#include <cmath>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <fstream>
#include <functional>
#include <memory>
#include <random>
#include <string>
#include <string_view>
#include <vector>

#include "figure.h"
#include "fileindex/optree/optree.h"

namespace {

using bench::Figure;
using vexlo::fileindex::OP;
using vexlo::fileindex::OPTree;

constexpr int64_t kSmall = 10'000;
constexpr int64_t kMiddle = 100'000;
constexpr int64_t kLarge = 1'000'000;
constexpr int64_t kHuge = 10'000'000;

std::string Line(uint32_t event, const std::string& path, const std::string& path_old = "") {
  return "{\"event\":" + std::to_string(event) + ",\"is_dir\":false,\"path\":\"" + path +
         "\",\"path_old\":\"" + path_old + "\",\"data\":null}\n";
}

std::string FolderLine(uint32_t event, const std::string& path, const std::string& path_old) {
  return "{\"event\":" + std::to_string(event) + ",\"is_dir\":true,\"path\":\"" + path +
         "\",\"path_old\":\"" + path_old + "\",\"data\":null}\n";
}

using Sink = std::function<void(const std::string&)>;

void SkewedOver(int64_t files, int64_t lines, const Sink& sink) {
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

void Skewed(int64_t lines, const Sink& sink) { SkewedOver(lines / 20, lines, sink); }

void SkewedFixed(int64_t lines, const Sink& sink) { SkewedOver(kLarge / 20, lines, sink); }

void Wide(int64_t lines, const Sink& sink) {
  constexpr uint32_t kPasses[] = {0x40, 8, 4, 8, 4};
  const int64_t files = lines / 5;
  for (const uint32_t event : kPasses) {
    for (int64_t file = 0; file < files; ++file) {
      sink(Line(event, "/volume1/mail/archive/message-" + std::to_string(file * 7919 % files)));
    }
  }
}

std::string DeepFolder() {
  std::string folder = "/volume1/src";
  for (int level = 0; level < 36; ++level) {
    folder += "/dir-" + std::to_string(level);
  }
  return folder;
}

void Deep(int64_t lines, const Sink& sink) {
  const std::string folder = DeepFolder();
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

void Children(int64_t lines, const Sink& sink) {
  for (int64_t file = 0; file < lines; ++file) {
    sink(Line(0x40, "/volume1/mail/archive/message-" + std::to_string(file * 7919 % lines)));
  }
}

void Renames(int64_t lines, const Sink& sink) {
  constexpr int64_t kRenames = 1000;
  const std::string folder = "/volume1/projects/job-";
  for (int64_t file = 0; file < lines - kRenames; ++file) {
    sink(Line(0x40, folder + "0/part-" + std::to_string(file)));
  }
  for (int64_t i = 0; i < kRenames; ++i) {
    sink(FolderLine(0x100, folder + std::to_string(i + 1), folder + std::to_string(i)));
  }
}

void Reindex(int64_t lines, const Sink& sink) {
  const std::string line = FolderLine(0x10000, DeepFolder(), "");
  for (int64_t i = 0; i < lines; ++i) {
    sink(line);
  }
}

void Folders(int64_t lines, const Sink& sink) {
  for (int64_t file = 0; file < lines; ++file) {
    sink(Line(0x40, "/volume1/photo/album" + std::to_string(file % 997) + "/IMG_" +
                        std::to_string(file) + ".JPG"));
  }
}

struct Case {
  const char* name;
  void (*write)(int64_t, const Sink&);
  std::vector<int64_t> sizes;
  double aim;  // Of the ratio to jsoncpp, at 1,000,000 lines; NAN: none.
};

const std::vector<Case>& Cases() {
  static const std::vector<Case> cases = {
      {"skewed", Skewed, {kSmall, kMiddle, kLarge, kHuge}, 0.25},
      {"skewed-fixed", SkewedFixed, {kLarge, kHuge}, NAN},
      {"wide", Wide, {kSmall, kMiddle, kLarge}, 0.25},
      {"deep", Deep, {kSmall, kMiddle, kLarge}, 0.25},
      {"folder-rename", FolderRename, {kSmall, kMiddle, kLarge}, 0.25},
      {"save-rename", SaveRename, {kSmall, kMiddle, kLarge}, 0.25},
      {"children", Children, {kLarge}, NAN},
      {"renames", Renames, {kMiddle + 1000}, NAN},
      {"reindex", Reindex, {kMiddle}, NAN},
  };
  return cases;
}

struct MemoryCase {
  const char* name;
  void (*write)(int64_t, const Sink&);
  int64_t lines;
  int64_t paths;
};
constexpr MemoryCase kMemoryCases[] = {{"memory/folders", Folders, 200'000, 200'000},
                                       {"memory/wide", Wide, kLarge, 200'000},
                                       {"memory/deep", Deep, kLarge, 250'000}};
constexpr double kMostBytesPerPath = 350;
constexpr double kMostGrowth = 1.3;

// A queue file of its own, removed at the end.
class Queue {
 public:
  Queue(void (*write)(int64_t, const Sink&), int64_t lines) {
    const char* const base = getenv("TMPDIR");
    path_ = std::string(base == nullptr ? "/tmp" : base) + "/pipeline_bench.XXXXXX";
    const int fd = mkstemp(path_.data());
    if (fd < 0) {
      perror(path_.c_str());
      exit(3);
    }
    close(fd);
    std::ofstream out(path_);
    write(lines, [&out](const std::string& line) { out << line; });
    out.close();
    if (!out) {
      (void)fprintf(stderr, "cannot write %s\n", path_.c_str());
      unlink(path_.c_str());
      exit(3);
    }
  }
  ~Queue() { unlink(path_.c_str()); }
  Queue(const Queue&) = delete;
  Queue& operator=(const Queue&) = delete;

  const std::string& Path() const { return path_; }

 private:
  std::string path_;
};

double ProcessorSeconds() {
  timespec now{};
  clock_gettime(CLOCK_PROCESS_CPUTIME_ID, &now);
  return static_cast<double>(now.tv_sec) + static_cast<double>(now.tv_nsec) * 1e-9;
}

bool failed = false;

void Check(bool right, const std::string& path) {
  if (!right) {
    (void)fprintf(stderr, "%s: lines were lost\n", path.c_str());
    failed = true;
  }
}

// Nanoseconds a line.
double Fold(const std::string& path, int64_t lines) {
  const double begin = ProcessorSeconds();
  {
    OPTree tree(path);
    size_t delivered = 0;
    tree.ProcessOP([&delivered](const std::shared_ptr<OP>&) { ++delivered; });
    Check(tree.GetLineCount() == static_cast<uint64_t>(lines) && tree.GetSkippedCount() == 0 &&
              delivered != 0,
          path);
  }
  return (ProcessorSeconds() - begin) * 1e9 / static_cast<double>(lines);
}

// The same for the baseline, which stops after `lines`.
double ParseAlone(const std::string& path, int64_t lines) {
  Json::CharReaderBuilder builder;
  builder["collectComments"] = false;
  const std::unique_ptr<Json::CharReader> reader(builder.newCharReader());
  const double begin = ProcessorSeconds();
  std::ifstream in(path);
  std::string line;
  int64_t parsed = 0;
  while (parsed < lines && std::getline(in, line)) {
    Json::Value value;
    parsed += reader->parse(line.data(), line.data() + line.size(), &value, nullptr) ? 1 : 0;
  }
  Check(parsed == lines, path);
  return (ProcessorSeconds() - begin) * 1e9 / static_cast<double>(lines);
}

int Passes(int64_t lines, bool quick) {
  if (quick) {
    return lines >= kLarge ? 1 : 3;
  }
  return lines > kLarge ? 2 : lines == kLarge ? 5 : 10;
}

void RunCase(const Case& queue_case, bool quick, std::vector<Figure>& figures) {
  std::vector<int64_t> sizes = queue_case.sizes;
  if (quick && sizes.back() > kLarge) {
    sizes.pop_back();
  }
  const int64_t longest = std::min(sizes.back(), kLarge);
  const auto first = static_cast<std::ptrdiff_t>(figures.size());
  double baseline = NAN;
  double at_large = NAN;
  for (const int64_t lines : sizes) {
    const Queue queue(queue_case.write, lines);
    Figure figure;
    figure.name = std::string("pipeline/") + queue_case.name + "/" + std::to_string(lines);
    figure.unit = "ns/line";
    for (int pass = Passes(lines, quick); pass > 0; --pass) {
      figure.value = std::fmin(figure.value, Fold(queue.Path(), lines));
      if (lines == longest) {
        baseline =
            std::fmin(baseline, ParseAlone(queue.Path(), quick ? std::min(lines, kMiddle) : lines));
      }
    }
    at_large = lines == kLarge ? figure.value : at_large;
    figure.baseline = lines > kLarge ? at_large : NAN;
    figure.aim = lines > kLarge ? kMostGrowth : lines == kLarge ? queue_case.aim : NAN;
    figures.push_back(figure);
  }
  std::for_each(figures.begin() + first, figures.end(), [baseline](Figure& figure) {
    figure.baseline = std::isnan(figure.baseline) ? baseline : figure.baseline;
  });
}

void RunMemoryCase(const MemoryCase& memory_case, std::vector<Figure>& figures) {
  const Queue queue(memory_case.write, memory_case.lines);
  const auto in_use = [] {
    const struct mallinfo2 info = mallinfo2();
    return static_cast<double>(info.uordblks) + static_cast<double>(info.hblkhd);
  };
  const double before = in_use();
  const OPTree tree(queue.Path());
  Figure figure;
  figure.name = memory_case.name;
  figure.unit = "bytes/path";
  figure.value = (in_use() - before) / static_cast<double>(memory_case.paths);
  figure.aim = kMostBytesPerPath;
  Check(tree.ops.size() == static_cast<size_t>(memory_case.paths), queue.Path());
  figures.push_back(figure);
}

}  // namespace

int main(int argc, char** argv) {
  bool quick = false;
  bool json = false;
  std::string_view only;
  for (int i = 1; i < argc; ++i) {
    const std::string_view argument = argv[i];
    if (argument == "--quick") {
      quick = true;
    } else if (argument == "--json") {
      json = true;
    } else if (only.empty() && !argument.starts_with("-")) {
      only = argument;
    } else {
      (void)fprintf(stderr, "usage: pipeline_bench [--quick] [--json] [NAME]\n");
      return 2;
    }
  }
  std::vector<Figure> figures;
  for (const MemoryCase& memory_case : kMemoryCases) {
    if (only.empty() || only == memory_case.name || only == "memory") {
      RunMemoryCase(memory_case, figures);
    }
  }
  for (const Case& queue_case : Cases()) {
    // Without the huge queue the fixed set of files has nothing to show.
    const bool shows = !quick || queue_case.write != SkewedFixed;
    if (only.empty() ? shows : only == queue_case.name) {
      RunCase(queue_case, quick, figures);
    }
  }
  if (figures.empty()) {
    (void)fprintf(stderr, "no case is called %s\n", std::string(only).c_str());
    return 2;
  }
  bench::Print(figures, json);
  return failed ? 1 : 0;
}
