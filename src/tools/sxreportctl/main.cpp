// sxreportctl: the command-line client and admin tool of the reporting service.
#include <exception>
#include <iostream>

#include "CtlLocal.h"
#include "CtlRemote.h"
#include "client/SXCtlArgs.h"

int main(int argc, char** argv) {
  try {
    SXCtlRequest request;
    std::string error;
    if (!SXCtlParse(std::vector<std::string>(argv + 1, argv + argc), request, error)) {
      std::cerr << "sxreportctl: " << error << "\n";
      return 2;
    }
    if (request.help) {
      std::cout << SXCtlHelp(request.command);
      return 0;
    }
    const SXPaths paths = SXCtlPaths(request);
    if (request.command == "events") return SXCtlRunEvents(request, paths);
    if (request.command == "defaults") return SXCtlRunDefaults(request, paths);
    if (request.command == "notify") return SXCtlRunNotify(request, paths);
    return SXCtlRunRemote(request, paths);
  } catch (const std::exception& e) {
    std::cerr << "sxreportctl: " << e.what() << "\n";
    return 2;
  }
}
