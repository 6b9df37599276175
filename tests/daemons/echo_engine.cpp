// The search engine's daemon around an engine that hands each request back.
#include <stdexcept>

#include "daemons/kavoelasticd/server.h"

namespace {

Json::Value Echo(const Json::Value& request) {
  if (request.isMember("throw")) {
    throw std::runtime_error("as asked");
  }
  return request;
}

}  // namespace

int main(int argc, char** argv) {
  vexlo::daemon::DaemonOptions options = vexlo::elasticd::ElasticdOptions();
  options.usage = "[throw|stuck]";
  std::string way;
  options.arguments = [&way](const std::vector<std::string>& arguments) {
    way = arguments.empty() ? "" : arguments[0];
    return way.empty() || way == "throw" || way == "stuck";
  };
  options.reload = [] { throw std::runtime_error("no settings"); };
  return RunDaemon(options, argc, argv, [&way](vexlo::daemon::Daemon& daemon) {
    if (way == "throw") {
      throw std::runtime_error("as asked");
    }
    if (way == "stuck") {
      daemon.EndAtOnce("as asked");
    }
    vexlo::elasticd::Serve(daemon, Echo);
  });
}
