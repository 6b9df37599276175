// The daemon as ParseFile() meets it: the real program on a root of its own.
#include <fcntl.h>
#include <json/writer.h>
#include <poll.h>
#include <sys/stat.h>
#include <sys/syscall.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <filesystem>
#include <iterator>
#include <optional>
#include <random>
#include <sstream>
#include <thread>

#include "common/json.h"
#include "kavo/content_extract.h"
#include "kavo/local/content.h"
#include "kavo/local/frames.h"
#include "samples.h"
#include "support/private_root.h"
#include "support/program.h"
#include "support/raw_client.h"

namespace vexlo::extractd {
namespace {

const PrivateRoot kRoot;
constexpr bool kLimitsMemory = *WORKER_MEMORY == '\0';
constexpr bool kIsConfined = kLimitsMemory;  // Sanitizers stand in the way of both.

std::string LinkOf(const std::filesystem::path& link) {
  std::error_code error;
  return std::filesystem::read_symlink(link, error);
}

class ExtractdTest : public testing::Test {
 protected:
  void TearDown() override {
    if (daemon_) {
      daemon_->End(SIGKILL);
    }
    std::filesystem::remove_all(kRoot / "var");
  }

  void Start(const std::string& arguments = "") {
    if (!std::filesystem::exists(kRoot / "var/run")) {
      kRoot.MakeFolder("var/run");
    }
    daemon_.emplace(":", EXTRACTD " " + arguments + WORKER_MEMORY " 2>&1");
    ASSERT_TRUE(daemon_->Await("ready\n")) << daemon_->text;
  }
  void Stop(int signal = SIGTERM) {
    EXPECT_EQ(daemon_->End(signal), signal == SIGTERM ? 0 : 128 + signal);
    daemon_.reset();
  }

  std::string Write(const std::string& name, const std::string& bytes) const {
    WriteText(files_ / name, bytes);
    return files_ / name;
  }
  static Json::Value Parse(const std::string& path) {
    Json::Value options;
    options["need_meta"] = true;
    Json::Value fields;
    KAVO::CONTENT_EXTRACT::ParseFile(path, options, fields);
    return fields;
  }
  static std::string ErrorOf(const std::string& path) {
    return Parse(path)["KAVOMDContentError"].asString();
  }
  static Json::Value Stats() {
    Json::Value stats;
    EXPECT_TRUE(JsonFromString(stats, Ask(kavo::local::ContentSocket(), R"({"command":"stats"})")));
    return stats;
  }

  // The processes that the daemon has started.
  std::vector<pid_t> Workers() const {
    std::vector<pid_t> workers;
    for (const auto& task :
         std::filesystem::directory_iterator("/proc/" + std::to_string(daemon_->pid) + "/task")) {
      std::ifstream children(task.path() / "children");
      for (pid_t pid = 0; children >> pid;) {
        workers.push_back(pid);
      }
    }
    return workers;
  }
  // Sends the signal to each worker that reads the file; how many it were. One that is just being
  // started has what the daemon has open, but another name.
  int SignalReadersOf(const std::string& path, int signal) const {
    int readers = 0;
    for (const pid_t worker : Workers()) {
      const std::string proc = "/proc/" + std::to_string(worker);
      std::error_code error;
      for (const auto& fd : std::filesystem::directory_iterator(proc + "/fd", error)) {
        if (LinkOf(fd.path()) == path && ReadText(proc + "/comm") == "kavoce-worker\n") {
          readers += kill(worker, signal) == 0 ? 1 : 0;
        }
      }
    }
    return readers;
  }
  // What is said of the file while each worker that reads it gets the signal.
  std::string ErrorUnder(int signal, const std::string& path) const {
    std::atomic<bool> is_done = false;
    std::thread signaller([&] {
      while (!is_done) {
        SignalReadersOf(path, signal);
      }
    });
    std::string error = ErrorOf(path);
    is_done = true;
    signaller.join();
    return error;
  }

  const TempFolder files_;
  std::optional<Program> daemon_;
};

// Takes a while to read, and says nothing.
std::string SlowDocument() {
  std::ostringstream content;
  std::fill_n(std::ostream_iterator<const char*>(content), 12000000, "<x/>");
  return Docx(content.str() + "<w:t>end</w:t>");
}

TEST_F(ExtractdTest, AddsTheContentToTheAttributes) {
  const std::string path = Write("plan.pdf", Pdf());
  EXPECT_TRUE(ErrorOf(path).starts_with("unavailable: kavocontentextractd does not run"));
  Start();
  const Json::Value fields = Parse(path);
  EXPECT_EQ(fields["KAVOMDTextContent"], "The harbour plan\n");
  EXPECT_EQ(fields["KAVOMDFSName"], "plan.pdf");
  EXPECT_FALSE(fields.isMember("KAVOMDContentError"));
  EXPECT_EQ(Stats()["files"], 1);
  Stop();
  EXPECT_TRUE(ErrorOf(path).starts_with("unavailable: "));
}

TEST_F(ExtractdTest, AnswersManyAtOnceAndReplacesWorkersThatHaveReadMuch) {
  Start("--workers 2 ");
  constexpr int kThreads = 8;
  constexpr int kFiles = 150;  // Of each thread: more than two workers read in their lives.
  std::vector<std::thread> threads;
  threads.reserve(kThreads);
  for (int i = 0; i < kThreads; ++i) {
    threads.emplace_back([this, i] {
      const std::string text = "thread " + std::to_string(i);
      const std::string path = Write(std::to_string(i) + ".html", "<p>" + text);
      for (int j = 0; j < kFiles; ++j) {
        EXPECT_EQ(Parse(path)["KAVOMDTextContent"], text + "\n");
      }
    });
  }
  for (std::thread& thread : threads) {
    thread.join();
  }
  EXPECT_EQ(Stats()["files"], kThreads * kFiles);
  EXPECT_EQ(Stats()["deaths"], 0);
  EXPECT_LE(Stats()["workers"].asInt(), 2);
}

TEST_F(ExtractdTest, SurvivesWhatIsDamaged) {
  Start("--deadline 5 ");
  unsigned seed = 1;
  for (const Sample& sample : Samples()) {
    for (int i = 0; i < 8; ++i, ++seed) {
      SCOPED_TRACE(sample.name + ", seed " + std::to_string(seed));
      std::string bytes = sample.bytes;
      if (i < 4) {
        bytes.resize(bytes.size() * static_cast<size_t>(i + 1) / 5);
      } else {
        std::mt19937 random(seed);
        for (int j = 0; j < 20; ++j) {
          bytes[random() % bytes.size()] = static_cast<char>(random());
        }
      }
      const Json::Value fields = Parse(Write("file", bytes));
      EXPECT_TRUE(fields.isMember("KAVOMDContentError") || fields.isMember("KAVOMDContentType"));
      EXPECT_FALSE(fields["KAVOMDContentError"].asString().starts_with("unavailable"));
    }
  }
  EXPECT_EQ(Parse(Write("file", Pdf()))["KAVOMDTitle"], "Plan");
}

TEST_F(ExtractdTest, StopsAtLimits) {
  Start("--deadline 60 ");
  const std::string mib(1 << 20, 'm');
  const Json::Value cut = Parse(Write("a.docx", Docx("<w:t>" + mib + "m</w:t>")));
  EXPECT_TRUE(cut["KAVOMDTextContent"] == mib && cut["KAVOMDTextTruncated"].asBool());
  EXPECT_FALSE(cut.isMember("KAVOMDContentError"));

  const Json::Value bomb =
      Parse(Write("b.docx", Docx("<w:t>begin</w:t><w:p/>" + std::string(size_t{129} << 20, ' '))));
  EXPECT_EQ(bomb["KAVOMDContentError"], "oversized: it unpacks to over 128 MiB");
  EXPECT_EQ(bomb["KAVOMDTextContent"], "begin\n");

  const Json::Value table = Parse(
      Write("c.xlsx", Zip({{"[Content_Types].xml", "<Types/>"},
                           {"xl/workbook.xml", "<w/>"},
                           {"xl/worksheets/sheet1.xml",
                            "<s><c><v>" + mib + "mm</v></c>" + std::string(size_t{129} << 20, ' ')},
                           {"xl/sharedStrings.xml", "<s><si><t>word</t></si></s>"}})));
  EXPECT_TRUE(table["KAVOMDTextContent"].asString().starts_with("word\nmmm"));
  EXPECT_FALSE(table.isMember("KAVOMDContentError")) << table["KAVOMDContentError"];
  EXPECT_EQ(Stats()["deaths"], 0);
}

TEST_F(ExtractdTest, RefusesWhatIsNoRequest) {
  Start();
  ASSERT_EQ(mkfifo((files_ / "fifo").c_str(), 0600), 0);
  Write("file", "text");
  const std::string extract = R"({"command":"extract","path":"/x"})";
  const struct {
    const char* name;
    std::string request;
    std::string file;
    int flags;
    std::string reply;
  } rows[] = {
      {"NoJson", "{", "file", O_RDONLY, "the request is no JSON object"},
      {"MistypedCommand", R"({"command":[1]})", "file", O_RDONLY, "none of the known commands"},
      {"MistypedPath", R"({"command":"extract","path":[1]})", "file", O_RDONLY, "text/plain"},
      {"ForWriting", extract, "file", O_WRONLY, "no file that can be read"},
      {"OnlyAPath", extract, "file", O_PATH, "no file that can be read"},
      {"Fifo", extract, "fifo", O_RDONLY | O_NONBLOCK, "no regular file"},
      {"TooLong", std::string(300 << 10, ' '), "file", O_RDONLY, "the request is too long"},
  };
  const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(60);
  for (const auto& row : rows) {
    SCOPED_TRACE(row.name);
    const RawClient file(open((files_ / row.file).c_str(), row.flags));
    const RawClient socket(kavo::local::ConnectWithin(kavo::local::ContentSocket(), deadline));
    EXPECT_TRUE(kavo::local::SendFrame(socket.fd, row.request, file.fd, deadline));
    std::string reply;
    EXPECT_TRUE(kavo::local::ReceiveFrame(socket.fd, 1 << 20, reply, nullptr, deadline));
    EXPECT_NE(reply.find(row.reply), std::string::npos) << reply;
  }
}

TEST_F(ExtractdTest, GivesWorkersNothingTheyDoNotNeed) {
  Start("--workers 1 ");
  Parse(Write("a.pdf", Pdf()));
  ASSERT_EQ(Workers().size(), 1);
  const std::string proc = "/proc/" + std::to_string(Workers()[0]);
  std::string limits = ReadText(proc + "/limits");
  std::erase(limits, ' ');
  const std::string memory = kLimitsMemory ? "536870912536870912" : "unlimitedunlimited";
  for (const std::string& limit :
       {"Maxaddressspace" + memory + "bytes", std::string("Maxfilesize00"),
        std::string("Maxcorefilesize00")}) {
    EXPECT_NE(limits.find("\n" + limit), std::string::npos) << limit << " is not in " << limits;
  }
  const std::string status = ReadText(proc + "/status");
  EXPECT_NE(status.find("NoNewPrivs:\t1"), std::string::npos);
  EXPECT_EQ(status.find("Uid:\t0"), std::string::npos) << status;
  EXPECT_NE(status.find("CapPrm:\t0000000000000000"), std::string::npos) << status;
  // Mode 2 is a filter.
  EXPECT_EQ(status.find("Seccomp:\t2") != std::string::npos, kIsConfined) << status;
  for (const auto& fd : std::filesystem::directory_iterator(proc + "/fd")) {
    const std::string link = LinkOf(fd.path());
    EXPECT_TRUE(link == "/dev/null" || (fd.path().filename() == "3" && link.starts_with("socket:")))
        << fd.path() << " " << link;
  }
}

TEST_F(ExtractdTest, ReplacesAWorkerThatHangs) {
  Start("--deadline 1 --workers 1 ");
  const std::string path = Write("a.pdf", Pdf());
  Parse(path);
  ASSERT_EQ(Workers().size(), 1);
  const pid_t first = Workers()[0];
  kill(first, SIGSTOP);
  EXPECT_EQ(Parse(path)["KAVOMDTitle"], "Plan");
  ASSERT_EQ(Workers().size(), 1);
  EXPECT_NE(Workers()[0], first);
  EXPECT_EQ(Stats()["deaths"], 1);
  EXPECT_EQ(Stats()["quarantined"], 0);

  // One that ends between two files is no fault of the next.
  const std::string socket = "/proc/" + std::to_string(Workers()[0]) + "/fd/3";
  kill(Workers()[0], SIGKILL);
  while (!LinkOf(socket).empty()) {  // Until the signal has arrived.
    std::this_thread::yield();
  }
  EXPECT_EQ(Parse(path)["KAVOMDTitle"], "Plan");
  EXPECT_EQ(Stats()["deaths"], 1);
}

TEST_F(ExtractdTest, QuarantinesWhatKillsTwoWorkersUntilItChanges) {
  Start();
  const std::string path = Write("slow.docx", SlowDocument());
  const std::string crash = "crash: the worker ended by signal 6 while it read the file";
  EXPECT_EQ(ErrorUnder(SIGABRT, path), crash);
  EXPECT_EQ(Stats()["deaths"], 2);
  EXPECT_EQ(Stats()["quarantined"], 1);
  EXPECT_EQ(ErrorOf(path), crash) << "answered from the list";
  EXPECT_EQ(Stats()["deaths"], 2);

  Stop(SIGKILL);
  Start();
  EXPECT_EQ(ErrorOf(path), crash) << "also by the next daemon";
  EXPECT_EQ(Stats()["workers"], 0);
  ASSERT_EQ(utimensat(AT_FDCWD, path.c_str(), nullptr, 0), 0);
  EXPECT_EQ(Parse(path)["KAVOMDTextContent"], "end\n");
  EXPECT_EQ(Stats()["quarantined"], 0);
}

TEST_F(ExtractdTest, QuarantinesWhoseWorkersAreKilledThreeTimesInARow) {
  Start();
  const std::string path = Write("slow.docx", SlowDocument());
  const std::string killed = ": the worker ended by signal 9 while it read the file";
  const struct {
    int signal;  // 0 harms nobody.
    std::string error;
  } rows[] = {{SIGKILL, "unavailable" + killed},
              {SIGKILL, "unavailable" + killed},
              {0, ""},
              {SIGKILL, "unavailable" + killed},
              {SIGKILL, "unavailable" + killed},
              {SIGKILL, "crash" + killed},
              {0, "crash" + killed}};
  for (const auto& row : rows) {
    EXPECT_EQ(ErrorUnder(row.signal, path), row.error) << "row " << &row - rows;
  }
  EXPECT_EQ(Stats()["deaths"], 5);
  EXPECT_EQ(Stats()["quarantined"], 1);
}

TEST_F(ExtractdTest, QuarantinesWhatTakesTooLongOrTooMuch) {
  if (!kLimitsMemory) {
    GTEST_SKIP() << "a sanitizer takes more memory than a worker may";
  }
  Start("--deadline 1 --memory 128 ");
  const std::string hungry = Write("a.html", std::string(32 << 20, 'x'));
  EXPECT_EQ(ErrorOf(hungry), "memory: reading takes over 128 MiB of memory");
  EXPECT_EQ(Stats()["quarantined"], 1);
  EXPECT_EQ(Parse(Write("a.pdf", Pdf()))["KAVOMDTitle"], "Plan");
  const std::string slow = Write("slow.docx", SlowDocument());
  EXPECT_EQ(ErrorUnder(SIGSTOP, slow), "deadline: reading takes over 1 seconds");
  EXPECT_EQ(Stats()["quarantined"], 2);
  EXPECT_EQ(Stats()["deaths"], 4);
}

TEST_F(ExtractdTest, EndsInOrderWhileAFileIsRead) {
  Start("--deadline 600 ");
  const std::string path = Write("slow.docx", SlowDocument());
  std::thread ending([&] {
    while (SignalReadersOf(path, SIGSTOP) == 0) {
      std::this_thread::yield();
    }
    kill(daemon_->pid, SIGTERM);
  });
  EXPECT_TRUE(ErrorOf(path).starts_with("unavailable: "));
  ending.join();
  Stop();
}

TEST_F(ExtractdTest, LeavesNoWorkerBehind) {
  Start();
  Parse(Write("a.pdf", Pdf()));
  const std::vector<pid_t> workers = Workers();
  ASSERT_EQ(workers.size(), 1);
  const RawClient process(static_cast<int>(syscall(SYS_pidfd_open, workers[0], 0)));
  Stop(SIGKILL);
  struct pollfd end = {process.fd, POLLIN, 0};
  EXPECT_EQ(poll(&end, 1, 30000), 1) << "it ends when its daemon is gone";
}

}  // namespace
}  // namespace vexlo::extractd
