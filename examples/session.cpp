// One reporting session from start to end: create, start (its answer comes when the
// session stops), send, stop, destroy.
//
//   c++ session.cpp $(pkg-config --cflags --libs vireo-client) -o session
// or with CMake: find_package(vireo) and link vireo::client (CMakeLists.txt here).
#include <chrono>
#include <cstdio>
#include <vireo/client.h>

using namespace vireo::client;

int main() {
  auto client = Client::connect();
  if (!client) return std::fprintf(stderr, "cannot connect: %s\n", client.error().message.c_str()), 1;
  Client& c = **client;
  const std::int64_t id = 1;
  bool answered = false;

  c.createReportingSession(id);
  c.startReportingSessionForID(id, [&](const Result<bool>& r) { answered = r.ok() && *r; });
  Status sent = c.sendMessage(vireo::Dictionary{{"event", "hello"}}, 3, 1, std::vector<std::int64_t>{id});
  c.stopReportingSessionForID(id);
  // Callbacks run while the connection is driven: pump() here, or the host's own loop
  // over fd()/events()/timeout() and process(), or startEventThread().
  for (int i = 0; !answered && i < 50; ++i) c.pump(std::chrono::milliseconds(100));
  c.destroyReportingSession(id);

  std::printf("sent: %s, start answered: %s\n", sent ? "ok" : sent.error().name.c_str(), answered ? "true" : "no");
  return sent && answered ? 0 : 1;
}
