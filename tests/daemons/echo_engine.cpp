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
  options.usage = "[fail]";
  bool fails = false;
  options.arguments = [&fails](const std::vector<std::string>& arguments) {
    fails = arguments == std::vector<std::string>{"fail"};
    return fails || arguments.empty();
  };
  options.reload = [] { throw std::runtime_error("no settings"); };
  return RunDaemon(options, argc, argv, [&fails](vexlo::daemon::Daemon& daemon) {
    if (fails) {
      throw std::runtime_error("as asked");
    }
    vexlo::elasticd::Serve(daemon, Echo);
  });
}
