#include "tests/e2e/Nats.h"

#include <arpa/inet.h>
#include <nats/nats.h>
#include <netinet/in.h>
#include <signal.h>
#include <sys/socket.h>
#include <unistd.h>

#include <filesystem>
#include <regex>

#include "common/Json.h"

namespace qn::e2e {
namespace {

// A loopback port free now (the server binds it right after).
int FreePort() {
  const int fd = ::socket(AF_INET, SOCK_STREAM, 0);
  sockaddr_in address{};
  address.sin_family = AF_INET;
  address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  socklen_t length = sizeof address;
  ::bind(fd, reinterpret_cast<sockaddr*>(&address), sizeof address);
  ::getsockname(fd, reinterpret_cast<sockaddr*>(&address), &length);
  ::close(fd);
  return ntohs(address.sin_port);
}

// The body of GET `path` on the loopback `port` ("" when it fails).
std::string HttpGet(int port, const std::string& path) {
  const int fd = ::socket(AF_INET, SOCK_STREAM, 0);
  sockaddr_in address{};
  address.sin_family = AF_INET;
  address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  address.sin_port = htons(static_cast<std::uint16_t>(port));
  timeval timeout{2, 0};
  ::setsockopt(fd, SOL_SOCKET, SO_RCVTIMEO, &timeout, sizeof timeout);
  std::string response;
  if (::connect(fd, reinterpret_cast<sockaddr*>(&address), sizeof address) == 0) {
    const std::string request = "GET " + path + " HTTP/1.0\r\n\r\n";
    if (::write(fd, request.data(), request.size()) == static_cast<ssize_t>(request.size())) {
      char buffer[65536];
      for (ssize_t n; (n = ::read(fd, buffer, sizeof buffer)) > 0;) response.append(buffer, n);
    }
  }
  ::close(fd);
  const std::size_t body = response.find("\r\n\r\n");
  return body == std::string::npos ? "" : response.substr(body + 4);
}

// The array at `key` of `value`, or an empty one.
const Array& ArrayAt(const Value& value, const char* key) {
  static const Array kNone;
  const Value* found = value.as_dictionary() ? value.as_dictionary()->Find(key) : nullptr;
  return found && found->as_array() ? *found->as_array() : kNone;
}

// The stream detail of `stream` in a /jsz answer, or null.
const Dictionary* StreamDetail(const Value& jsz, const std::string& stream) {
  for (const Value& account : ArrayAt(jsz, "account_details")) {
    for (const Value& s : ArrayAt(account, "stream_detail")) {
      if (*s.as_dictionary()->Find("name") == Value(stream)) return s.as_dictionary();
    }
  }
  return nullptr;
}

Value Jsz(int monitor) {
  Value jsz;
  // Unlimited reservations come as 2^64-1, beyond what a Value holds.
  const std::string text = std::regex_replace(HttpGet(monitor, "/jsz?accounts=true&streams=true"),
                                              std::regex("18446744073709551615"), "-1");
  if (ParseJson(text, jsz)) return Value();
  return jsz;
}

}  // namespace

NatsCluster::NatsCluster(std::string dir, int size) : dir_(std::move(dir)), nodes_(size) {
  for (Node& node : nodes_) node = {FreePort(), FreePort(), FreePort(), nullptr};
  for (int i = 0; i < size; ++i) Start(i);
}

void NatsCluster::Start(int i) {
  Node& node = nodes_[i];
  const std::string name = "n" + std::to_string(i), dir = dir_ + "/" + name;
  std::filesystem::create_directories(dir);
  std::vector<std::string> args{
      "-a",  "127.0.0.1", "-p", std::to_string(node.port), "-m", std::to_string(node.monitor),
      "-js", "-sd",       dir,  "--server_name",           name};
  if (size() > 1) {
    std::string routes;
    for (const Node& peer : nodes_)
      routes += (routes.empty() ? "" : ",") + ("nats://127.0.0.1:" + std::to_string(peer.route));
    args.insert(args.end(), {"--cluster_name", "qn", "--cluster",
                             "nats://127.0.0.1:" + std::to_string(node.route), "--routes", routes});
  }
  node.process.reset();  // a killed one is reaped first
  node.process = std::make_unique<ChildProcess>("/usr/sbin/nats-server", args, dir);
  ASSERT_TRUE(Eventually([&] { return !HttpGet(node.monitor, "/varz").empty(); }))
      << node.process->Stderr();
}

void NatsCluster::Kill(int i) {
  nodes_[i].process->Signal(SIGKILL);
  nodes_[i].process->Wait();
}

void NatsCluster::Pause(int i, bool paused) {
  nodes_[i].process->Signal(paused ? SIGSTOP : SIGCONT);
}

std::string NatsCluster::Url(int i) const {
  return "nats://127.0.0.1:" + std::to_string(nodes_[i].port);
}

std::string NatsCluster::Urls() const {
  std::string urls;
  for (int i = 0; i < size(); ++i) urls += (i ? "," : "") + Url(i);
  return urls;
}

std::int64_t NatsCluster::ReplicaCount(int i, const std::string& stream) const {
  const Value jsz = Jsz(nodes_[i].monitor);
  const Dictionary* detail = StreamDetail(jsz, stream);
  const Value* state = detail ? detail->Find("state") : nullptr;
  const Value* messages =
      state && state->as_dictionary() ? state->as_dictionary()->Find("messages") : nullptr;
  return messages ? messages->as_int64().value_or(-1) : -1;
}

int NatsCluster::Leader(const std::string& stream) const {
  for (int i = 0; i < size(); ++i) {
    const Value jsz = Jsz(nodes_[i].monitor);
    const Dictionary* detail = StreamDetail(jsz, stream);
    const Value* cluster = detail ? detail->Find("cluster") : nullptr;
    const Value* leader =
        cluster && cluster->as_dictionary() ? cluster->as_dictionary()->Find("leader") : nullptr;
    if (leader && *leader == Value("n" + std::to_string(i))) return i;
  }
  return -1;
}

std::vector<StreamMessage> ReadStream(const std::string& urls, const std::string& stream,
                                      std::size_t expected) {
  std::vector<StreamMessage> messages;
  natsConnection* nc = nullptr;
  jsCtx* js = nullptr;
  natsSubscription* sub = nullptr;
  jsSubOptions options;
  jsSubOptions_Init(&options);
  options.Stream = stream.c_str();
  options.Ordered = true;
  // Making the consumer fails while the cluster still elects leaders.
  if (Eventually([&] {
        natsSubscription_Destroy(sub);
        jsCtx_Destroy(js);
        natsConnection_Destroy(nc);
        sub = nullptr, js = nullptr, nc = nullptr;
        return natsConnection_ConnectTo(&nc, urls.c_str()) == NATS_OK &&
               natsConnection_JetStream(&js, nc, nullptr) == NATS_OK &&
               js_SubscribeSync(&sub, js, "quenta.>", nullptr, &options, nullptr) == NATS_OK;
      })) {
    // Ends once `expected` came, or when none came for kPatience (a sanitizer build reads
    // slowly, but steadily).
    auto deadline = std::chrono::steady_clock::now() + kPatience;
    while (messages.size() < expected && std::chrono::steady_clock::now() < deadline) {
      natsMsg* msg = nullptr;
      if (natsSubscription_NextMsg(&msg, sub, 1000) != NATS_OK) continue;
      deadline = std::chrono::steady_clock::now() + kPatience;
      StreamMessage& out = messages.emplace_back();
      out.subject = natsMsg_GetSubject(msg);
      const char* id = nullptr;
      if (natsMsgHeader_Get(msg, "Nats-Msg-Id", &id) == NATS_OK) out.msg_id = id;
      out.body = Json(std::string(natsMsg_GetData(msg), natsMsg_GetDataLength(msg)));
      natsMsg_Destroy(msg);
    }
  }
  natsSubscription_Destroy(sub);
  jsCtx_Destroy(js);
  natsConnection_Destroy(nc);
  return messages;
}

}  // namespace qn::e2e
