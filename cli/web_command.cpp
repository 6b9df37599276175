// "fileindex web": a page for looking with a browser.
#include <unistd.h>

#include <csignal>
#include <cstdlib>
#include <ctime>

#include "cli/command.h"
#include "cli/stop_signals.h"
#include "cli/web/api.h"
#include "cli/web/guard.h"
#include "cli/web/http_server.h"
#include "cli/web/loopback.h"

namespace vexlo::cli {
namespace {

constexpr const char* kDefaultPlace = "127.0.0.1:8410";
constexpr timespec kTendInterval = {0, 500'000'000};
constexpr auto kStopPatience = std::chrono::seconds(3);

ExitStatus Web(const Arguments& arguments, const Console& console) {
  const sockaddr_storage address =
      ReadLoopbackAddress(arguments.Has("--listen") ? arguments.Get("--listen") : kDefaultPlace);
  // The threads inherit this, so a signal is for the wait below.
  const sigset_t signals = StopSignalSet();
  pthread_sigmask(SIG_BLOCK, &signals, nullptr);
  const int socket = ListenOn(address);
  const std::string place = ListeningPlace(socket);
  const std::string token = MakeToken();
  HttpServer server(socket, WebLanes(),
                    [&token](const HttpRequest& request) { return AnswerRequest(request, token); });
  console.out << "http://" << place << "/#token=" << token << "\n" << std::flush;
  console.err << "open that in a browser; whoever has it can search and pause; Ctrl-C ends it\n"
              << std::flush;
  while (sigtimedwait(&signals, nullptr, &kTendInterval) < 0) {
    server.Tend();
  }
  if (!server.Stop(kStopPatience)) {
    // A daemon keeps a request waiting. Whatever is saved is saved whole, so nothing is lost.
    console.out.flush();
    _exit(kDone);
  }
  return kDone;
}

}  // namespace

std::vector<Command> WebCommands() {
  return {
      {"web",
       "",
       "serves a page for searching with a browser until Ctrl-C",
       "Prints the address of a page that searches, shows how far the indexed folders are, and\n"
       "pauses and resumes indexing. The address ends in a token, another one each time: whoever\n"
       "has it sees what you may see, and nobody else does. The page is there for programs of\n"
       "this machine only; from another one, 'ssh -L 8410:127.0.0.1:8410 MACHINE' leads to it.\n"
       "\n"
       "  fileindex web\n"
       "  fileindex web --listen 127.0.0.1:0\n",
       {{"--listen", "ADDRESS", "a loopback address and a port (127.0.0.1:8410); port 0 is any"}},
       {},
       0,
       0,
       Web},
  };
}

}  // namespace vexlo::cli
