#include <cstring>
#include <string>

#include "common/Json.h"
#include "qnreporting/Client.h"
#include "qnreporting/qnreporting.h"

struct qn_client {
  std::unique_ptr<qn::client::Client> client;
};

namespace {

using qn::client::Timeout;

Timeout TimeoutOf(int timeout_ms) {
  return timeout_ms > 0 ? Timeout(timeout_ms) : qn::client::kDefaultTimeout;
}

int FromBool(const std::optional<bool>& reply) { return reply ? 0 : QN_NO_REPLY; }

// A JSON object, or nullopt.
std::optional<qn::Value> ObjectOf(const char* json) {
  if (json == nullptr) return std::nullopt;
  qn::Value value;
  if (qn::ParseJson(json, value) || !value.is_dictionary()) return std::nullopt;
  return value;
}

}  // namespace

extern "C" {

qn_client* qn_client_connect(const char* socket_path, char* error, size_t error_size) {
  std::string problem;
  auto client = qn::client::Client::Connect(
      socket_path ? std::string(socket_path) : qn::client::DefaultSocketPath(), &problem);
  if (!client) {
    if (error != nullptr && error_size > 0) {
      std::strncpy(error, problem.c_str(), error_size - 1);
      error[error_size - 1] = '\0';
    }
    return nullptr;
  }
  return new qn_client{std::move(client)};
}

void qn_client_free(qn_client* client) { delete client; }

int qn_client_connected(const qn_client* client) {
  return client && client->client->connected() ? 1 : 0;
}

int qn_client_create_session(qn_client* client, int64_t reporter_id, int timeout_ms) {
  if (!client) return QN_BAD_ARGUMENT;
  return FromBool(client->client->createReportingSessionSync(reporter_id, TimeoutOf(timeout_ms)));
}

int qn_client_set_service_type(qn_client* client, int64_t reporter_id, uint16_t service_type,
                               int timeout_ms) {
  if (!client) return QN_BAD_ARGUMENT;
  return FromBool(
      client->client->setServiceTypeSync(service_type, reporter_id, TimeoutOf(timeout_ms)));
}

int qn_client_set_configuration(qn_client* client, int64_t reporter_id,
                                const char* configuration_json, int timeout_ms) {
  auto configuration = ObjectOf(configuration_json);
  if (!client || !configuration) return QN_BAD_ARGUMENT;
  return FromBool(client->client->setConfigurationSync(std::move(*configuration), reporter_id,
                                                       TimeoutOf(timeout_ms)));
}

int qn_client_start_session(qn_client* client, int64_t reporter_id) {
  if (!client) return QN_BAD_ARGUMENT;
  return client->client->startReportingSessionForID(reporter_id, nullptr) != 0 ? 0 : QN_NO_REPLY;
}

int qn_client_stop_session(qn_client* client, int64_t reporter_id, int timeout_ms) {
  if (!client) return QN_BAD_ARGUMENT;
  return FromBool(
      client->client->stopReportingSessionForIDSync(reporter_id, TimeoutOf(timeout_ms)));
}

int qn_client_destroy_session(qn_client* client, int64_t reporter_id, int timeout_ms) {
  if (!client) return QN_BAD_ARGUMENT;
  return FromBool(client->client->destroyReportingSessionSync(reporter_id, TimeoutOf(timeout_ms)));
}

int qn_client_send_message(qn_client* client, const char* message_json, uint32_t category,
                           uint16_t type, const int64_t* reporter_ids, size_t count,
                           int timeout_ms) {
  auto message = ObjectOf(message_json);
  if (!client || !message) return QN_BAD_ARGUMENT;
  std::optional<std::vector<std::int64_t>> ids;
  if (reporter_ids != nullptr) ids.emplace(reporter_ids, reporter_ids + count);
  auto reply = client->client->sendMessageSync(std::move(*message), category, type, std::move(ids),
                                               TimeoutOf(timeout_ms));
  if (!reply) return QN_NO_REPLY;
  return reply->has_value() ? QN_REPORTING_DISABLED : 0;
}

int qn_client_get_service_type(qn_client* client, int64_t reporter_id, uint16_t* service_type,
                               int timeout_ms) {
  if (!client || !service_type) return QN_BAD_ARGUMENT;
  auto reply = client->client->getServiceNameForReporterIDSync(reporter_id, TimeoutOf(timeout_ms));
  if (!reply) return QN_NO_REPLY;
  *service_type = *reply;
  return 0;
}

int qn_client_reporter_id_valid(qn_client* client, int64_t reporter_id, int64_t* found_id,
                                uint16_t* service_type, int timeout_ms) {
  if (!client || !found_id || !service_type) return QN_BAD_ARGUMENT;
  auto reply = client->client->reporterIDValidSync(reporter_id, TimeoutOf(timeout_ms));
  if (!reply) return QN_NO_REPLY;
  const qn::Value* id = reply->Find("reporterID");
  const qn::Value* type = reply->Find("serviceType");
  *found_id = id ? id->as_int64().value_or(0) : 0;
  *service_type = static_cast<uint16_t>(type ? type->as_uint64().value_or(65535) : 65535);
  return 0;
}

int qn_client_get_all_reporters(qn_client* client, int64_t* ids, size_t capacity, size_t* count,
                                int timeout_ms) {
  if (!client || !count || (ids == nullptr && capacity > 0)) return QN_BAD_ARGUMENT;
  auto reply = client->client->getAllReportersSync(TimeoutOf(timeout_ms));
  if (!reply) return QN_NO_REPLY;
  *count = reply->size();
  for (size_t i = 0; i < reply->size() && i < capacity; ++i) ids[i] = (*reply)[i];
  return 0;
}

int qn_client_kill_service(qn_client* client) {
  if (!client) return QN_BAD_ARGUMENT;
  if (client->client->killService() == 0) return QN_NO_REPLY;
  client->client->Flush();
  return 0;
}

}  // extern "C"
