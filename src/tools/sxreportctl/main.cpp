// sxreportctl: the command-line client and admin tool of the reporting service.
#include <exception>
#include <iostream>
#include <memory>

#include "CtlArgs.h"
#include "CtlLocal.h"
#include "CtlRemote.h"

namespace {

int runLocal(const SXCtlRequest& request, const SXPaths& paths) {
  if (request.command == "events") return SXCtlRunEvents(request, paths);
  if (request.command == "sizes") return SXCtlRunSizes(request, paths);
  if (request.command == "defaults") return SXCtlRunDefaults(request, paths);
  return SXCtlRunNotify(request, paths);
}

bool isLocal(const SXCtlRequest& request) {
  return request.command == "events" || request.command == "sizes" ||
         request.command == "defaults" || request.command == "notify";
}

// Runs the commands in order on one connection, made when the first command needs it.
int runChain(const std::vector<SXCtlRequest>& requests) {
  const SXPaths paths = SXCtlPaths(requests.front());
  std::unique_ptr<SXReportingClient> client;
  for (const auto& request : requests) {
    if (!isLocal(request) && !client) {
      client = std::make_unique<SXReportingClient>(SXClientOptions{paths.socketPath});
      std::string error;
      if (!client->connect(&error)) {
        std::cerr << "sxreportctl: " << error << " (is sxreportingd running?)\n";
        return kSXCtlUnreachable;
      }
    }
    const int status =
        isLocal(request) ? runLocal(request, paths) : SXCtlRunRemote(request, *client);
    if (status != kSXCtlOK) return status;
  }
  return kSXCtlOK;
}

}  // namespace

int main(int argc, char** argv) {
  try {
    const SXCtlCommandLine line = SXCtlParseChain(std::vector<std::string>(argv + 1, argv + argc));
    if (line.exitStatus) {
      (*line.exitStatus == kSXCtlOK ? std::cout : std::cerr) << line.text;
      return *line.exitStatus;
    }
    return runChain(line.requests);
  } catch (const std::exception& e) {
    std::cerr << "sxreportctl: " << e.what() << "\n";
    return kSXCtlLocalError;
  }
}
