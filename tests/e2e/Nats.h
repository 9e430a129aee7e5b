#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "tests/e2e/Daemon.h"

namespace qn::e2e {

// nats-server with JetStream on loopback ports picked here, its files under `dir`: one
// server, or a cluster of `size` (routes between all). Each is started and stopped by its
// PID (SIGKILL at the end, also when the test fails).
class NatsCluster {
 public:
  NatsCluster(std::string dir, int size);
  void Start(int node);
  void Kill(int node);                // kill -9
  void Pause(int node, bool paused);  // SIGSTOP / SIGCONT
  std::string Url(int node) const;
  std::string Urls() const;  // all, comma-separated
  int size() const { return static_cast<int>(nodes_.size()); }
  // The messages of `stream` on `node`'s replica from its monitoring port (/jsz), or -1.
  std::int64_t ReplicaCount(int node, const std::string& stream) const;
  // The node whose replica of `stream` leads, or -1.
  int Leader(const std::string& stream) const;

 private:
  struct Node {
    int port = 0, monitor = 0, route = 0;
    std::unique_ptr<ChildProcess> process;
  };
  std::string dir_;
  std::vector<Node> nodes_;
};

// One stored message of a stream.
struct StreamMessage {
  std::string subject, msg_id;
  Value body;
};
// Every message of `stream` (read with an ordered consumer from `urls`), waiting until
// there are `expected`; fewer when none comes for kPatience.
std::vector<StreamMessage> ReadStream(const std::string& urls, const std::string& stream,
                                      std::size_t expected);

}  // namespace qn::e2e
