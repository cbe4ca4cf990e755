// A client built only from the installed headers and library: connects to the socket named by
// its argument, creates a session, asks whether it exists and prints the answer.
#include <sxreporting/client.h>

#include <cstdio>
#include <string>

int main(int argc, char** argv) {
  if (argc != 2) {
    std::fprintf(stderr, "usage: %s SOCKET\n", argv[0]);
    return 2;
  }
  SXReportingClient client(SXClientOptions{argv[1]});
  std::string error;
  if (!client.connect(&error)) {
    std::fprintf(stderr, "cannot connect: %s\n", error.c_str());
    return 1;
  }
  auto created = client.createReportingSession(7).get();
  auto valid = client.reporterID(7).get();
  if (!created.replied() || !valid.replied()) {
    std::fprintf(stderr, "no reply: %s%s\n", created.error.c_str(), valid.error.c_str());
    return 1;
  }
  std::printf("created %s, valid reporterID %lld serviceType %u\n",
              created.value ? "true" : "false", static_cast<long long>(valid.value.reporterID),
              static_cast<unsigned>(valid.value.serviceType));
  return 0;
}
