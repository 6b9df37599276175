#include "daemons/kavocontentextractd/worker.h"

#include <iconv.h>
#include <sys/prctl.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cerrno>
#include <csignal>
#include <cstdlib>
#include <ctime>
#include <exception>
#include <new>
#include <string>
#include <system_error>

#include "common/json.h"
#include "daemons/common/unique_fd.h"
#include "daemons/kavocontentextractd/extract.h"
#include "daemons/kavocontentextractd/pool.h"
#include "kavo/local/frames.h"

namespace vexlo::extractd {
namespace {

// A file, and what reading it takes.
constexpr rlim_t kMostFiles = 64;
constexpr size_t kMaxRequestBytes = size_t{64} << 10;
// No wait of a worker's has an end of its own: the daemon ends the worker.
constexpr kavo::local::Deadline kNever = kavo::local::Deadline::max();

bool Limit(int resource, rlim_t value) {
  const struct rlimit limit = {value, value};
  return setrlimit(resource, &limit) == 0;
}

// A table that comes with poppler, for documents in Chinese, Japanese and Korean; where it is
// installed, it is read when the first of them is.
constexpr char kCharacterMaps[] = "/usr/share/poppler";

// The encodings of pages and documents, as browsers know them. The C library has a module for each,
// which is loaded when it is first wanted and stays for as long as it is used.
constexpr const char* kEncodings[] = {
    "BIG5",        "BIG5-HKSCS",  "CP874",       "CP932",       "CP936",       "CP949",
    "CP1250",      "CP1251",      "CP1252",      "CP1253",      "CP1254",      "CP1255",
    "CP1256",      "CP1257",      "CP1258",      "EUC-JP",      "EUC-KR",      "GB18030",
    "GBK",         "IBM866",      "ISO-2022-JP", "ISO-8859-1",  "ISO-8859-2",  "ISO-8859-3",
    "ISO-8859-4",  "ISO-8859-5",  "ISO-8859-6",  "ISO-8859-7",  "ISO-8859-8",  "ISO-8859-9",
    "ISO-8859-10", "ISO-8859-13", "ISO-8859-14", "ISO-8859-15", "ISO-8859-16", "KOI8-R",
    "KOI8-U",      "MACINTOSH",   "SHIFT_JIS",   "UTF-16",      "UTF-32",      "UTF-7",
};

bool GiveUpRights(size_t memory, const daemon::Account& account) {
  // A file over the limit is an error where it is written, not a signal.
  signal(SIGXFSZ, SIG_IGN);
  close_range(kWorkerSocket + 1, ~0U, 0);  // What whoever started the daemon has left open.
  prctl(PR_SET_NAME, "kavoce-worker");     // It was started as "exe".
  // The daemon's end ends a worker that is busy, too; an idle one sees its socket closed. A change
  // of the user would undo it.
  return daemon::BecomeAccount(account) && daemon::KeepCapabilities({}) &&
         prctl(PR_SET_PDEATHSIG, SIGKILL) == 0 && Limit(RLIMIT_FSIZE, 0) && Limit(RLIMIT_CORE, 0) &&
         Limit(RLIMIT_NOFILE, kMostFiles) &&
         (memory == 0 || Limit(RLIMIT_AS, static_cast<rlim_t>(memory) << 20));
}

// Loads what libraries would look for in files later.
void LoadAhead() {
  for (const char* const encoding : kEncodings) {
    (void)iconv_open("UTF-8", encoding);  // Held to the end, as closing it might unload the module.
    (void)iconv_open(encoding, "UTF-8");
  }
  // Unset, the C library asks for the file's attributes at each conversion of a time.
  // NOLINTNEXTLINE(concurrency-mt-unsafe): there is one thread.
  setenv("TZ", ":/etc/localtime", /*overwrite=*/0);
  tzset();
}

// Why it cannot be, or "".
std::string Confine() {
  if (!daemon::kCanBeConfined) {
    return "";
  }
  const daemon::PathRule paths = daemon::ForbidPaths({kCharacterMaps});
  const bool is_done = paths != daemon::PathRule::kFailed &&
                       daemon::AllowReadingOnly(kWorkerSocket,
                                                /*may_open=*/paths == daemon::PathRule::kInForce);
  return is_done ? "" : std::generic_category().message(errno);
}

}  // namespace

int RunWorker(size_t memory, const daemon::Account& account) {
  const daemon::UniqueFd socket(kWorkerSocket);
  if (!GiveUpRights(memory, account)) {
    return 1;
  }
  const Extractor extractor;
  LoadAhead();
  const std::string complaint = Confine();
  if (!kavo::local::SendFrame(socket.Get(), complaint, -1, kNever) || !complaint.empty()) {
    return 1;
  }
  std::string text;
  int number = -1;
  while (kavo::local::ReceiveFrame(socket.Get(), kMaxRequestBytes, text, &number, kNever)) {
    daemon::UniqueFd file(number);
    std::string reply;
    try {
      Json::Value request;
      JsonFromString(request, text);
      reply = JsonToString(extractor.Extract(file.Get(), request["name"].asString()));
    } catch (const std::bad_alloc&) {
      _exit(kOutOfMemory);  // There may be none for an answer, and what is left is in pieces.
    }
    file.Reset();  // Nothing of it is held once the daemon has its answer.
    if (!kavo::local::SendFrame(socket.Get(), reply, -1, kNever)) {
      return 1;
    }
  }
  return 0;
}

}  // namespace vexlo::extractd
