// The C interface: each function is the C++ one behind it, with handles for objects
// and nothing thrown across.
#include <chrono>
#include <exception>
#include <optional>
#include <utility>
#include <vector>

#include "ostrel/OstrelReportingClient.h"
#include "ostrel/reporting.h"

namespace reporting = ostrel::reporting;

struct ostrel_client {
  explicit ostrel_client(reporting::Options options) : client(std::move(options)) {}
  reporting::Client client;
};
struct ostrel_message {
  reporting::Message message;
};
struct ostrel_list {
  reporting::List list;
};
struct ostrel_prepared_message {
  reporting::PreparedMessage message;
  std::vector<reporting::PreparedMessage::Field> fields;
};
struct ostrel_audio_sender {
  reporting::AudioSender sender;
};

namespace {

using reporting::Category;
using reporting::MessageType;
using reporting::OnReply;
using reporting::Reply;
using reporting::ReporterID;
using reporting::ReporterIDs;
using reporting::ServiceType;
using reporting::Submission;

static_assert(static_cast<int>(Submission::kClosed) == OSTREL_CLIENT_CLOSED);
static_assert(static_cast<int>(reporting::Status::kClosed) == OSTREL_CLOSED);

ostrel_status statusOf(const reporting::ReplyStatus& reply) {
  return static_cast<ostrel_status>(reply.status);
}

template <typename Make>
auto orNull(Make make) noexcept -> decltype(make()) {
  try {
    return make();
  } catch (const std::exception&) {
    return nullptr;
  }
}

template <typename Change>
bool change(bool hasHandles, Change change) noexcept {
  if (!hasHandles) return false;
  try {
    change();
    return true;
  } catch (const std::exception&) {
    return false;
  }
}

template <typename Submit>
ostrel_submission submit(ostrel_client* client, Submit submit) noexcept {
  if (client == nullptr) return OSTREL_INVALID;
  try {
    return static_cast<ostrel_submission>(submit(client->client));
  } catch (const std::exception&) {
    return OSTREL_NO_MEMORY;
  }
}

OnReply<bool> onBool(ostrel_bool_reply reply, void* context) {
  if (reply == nullptr) return {};
  return [reply, context](const Reply<bool>& answer) {
    reply(context, statusOf(answer), answer.value);
  };
}

std::optional<ReporterIDs> idsOf(const int64_t* ids, size_t count) {
  if (ids == nullptr) return std::nullopt;
  ReporterIDs list;
  list.reserve(count);
  for (size_t i = 0; i < count; ++i) list.push_back(ReporterID{ids[i]});
  return list;
}

template <typename T>
bool set(ostrel_message* message, const char* key, T value) {
  return change(message != nullptr && key != nullptr,
                [&] { message->message.set(key, value); });
}

template <typename T>
bool append(ostrel_list* list, T value) {
  return change(list != nullptr, [&] { list->list.append(value); });
}

reporting::PreparedMessage::Field fieldOf(const ostrel_prepared_message& message,
                                          int field) {
  const auto index = static_cast<std::size_t>(field);
  return field >= 0 && index < message.fields.size()
             ? message.fields[index]
             : reporting::PreparedMessage::Field();
}

}  // namespace

ostrel_client* ostrel_client_create(const ostrel_options* options) {
  return orNull([&] {
    reporting::Options chosen;
    if (options != nullptr) {
      if (options->socket_path != nullptr) chosen.socketPath = options->socket_path;
      if (options->reply_timeout_ms != 0) {
        chosen.replyTimeout = std::chrono::milliseconds(options->reply_timeout_ms);
      }
      if (options->queue_bytes != 0) chosen.queueBytes = options->queue_bytes;
      chosen.restoreSessions = options->restore_sessions;
    }
    return new ostrel_client(std::move(chosen));
  });
}

void ostrel_client_destroy(ostrel_client* client) { delete client; }

bool ostrel_client_flush(ostrel_client* client, uint32_t timeout_ms) {
  return client != nullptr && client->client.flush(std::chrono::milliseconds(timeout_ms));
}

bool ostrel_client_is_connected(const ostrel_client* client) {
  return client != nullptr && client->client.isConnected();
}

ostrel_counts ostrel_client_counts(const ostrel_client* client) {
  if (client == nullptr) return {};
  const reporting::Counts counts = client->client.counts();
  return {counts.droppedRequests, counts.timedOutRequests, counts.connections};
}

ostrel_submission ostrel_create_session(ostrel_client* client, int64_t reporter_id,
                                        ostrel_bool_reply reply, void* context) {
  return submit(client, [&](reporting::Client& to) {
    return to.createReportingSession(ReporterID{reporter_id}, onBool(reply, context));
  });
}

ostrel_submission ostrel_set_service_type(ostrel_client* client, uint16_t service_type,
                                          int64_t reporter_id, ostrel_bool_reply reply,
                                          void* context) {
  return submit(client, [&](reporting::Client& to) {
    return to.setServiceType(ServiceType{service_type}, ReporterID{reporter_id},
                             onBool(reply, context));
  });
}

ostrel_submission ostrel_get_service_type(ostrel_client* client, int64_t reporter_id,
                                          ostrel_service_type_reply reply,
                                          void* context) {
  return submit(client, [&](reporting::Client& to) {
    OnReply<ServiceType> handler;
    if (reply != nullptr) {
      handler = [reply, context](const Reply<ServiceType>& answer) {
        reply(context, statusOf(answer), static_cast<uint16_t>(answer.value));
      };
    }
    return to.getServiceNameForReporterID(ReporterID{reporter_id}, std::move(handler));
  });
}

ostrel_submission ostrel_set_configuration(ostrel_client* client,
                                           const ostrel_message* configuration,
                                           int64_t reporter_id, ostrel_bool_reply reply,
                                           void* context) {
  if (configuration == nullptr) return OSTREL_INVALID;
  return submit(client, [&](reporting::Client& to) {
    return to.setConfiguration(configuration->message, ReporterID{reporter_id},
                               onBool(reply, context));
  });
}

ostrel_submission ostrel_start_session(ostrel_client* client, int64_t reporter_id,
                                       ostrel_bool_reply reply, void* context) {
  return submit(client, [&](reporting::Client& to) {
    return to.startReportingSessionForID(ReporterID{reporter_id}, onBool(reply, context));
  });
}

ostrel_submission ostrel_send_message(ostrel_client* client,
                                      const ostrel_message* message, uint32_t category,
                                      uint16_t type, const int64_t* reporter_ids,
                                      size_t count, ostrel_error_reply reply,
                                      void* context) {
  if (message == nullptr) return OSTREL_INVALID;
  return submit(client, [&](reporting::Client& to) {
    OnReply<void> handler;
    if (reply != nullptr) {
      handler = [reply, context](const Reply<void>& answer) {
        const ostrel_error error{answer.error.domain.c_str(), answer.error.code,
                                 answer.error.description.c_str()};
        const bool isRefused = answer.status == reporting::Status::kRefused;
        reply(context, statusOf(answer), isRefused ? &error : nullptr);
      };
    }
    return to.sendMessage(message->message, Category{category}, MessageType{type},
                          idsOf(reporter_ids, count), std::move(handler));
  });
}

ostrel_submission ostrel_stop_session(ostrel_client* client, int64_t reporter_id,
                                      ostrel_bool_reply reply, void* context) {
  return submit(client, [&](reporting::Client& to) {
    return to.stopReportingSessionForID(ReporterID{reporter_id}, onBool(reply, context));
  });
}

ostrel_submission ostrel_destroy_session(ostrel_client* client, int64_t reporter_id,
                                         ostrel_bool_reply reply, void* context) {
  return submit(client, [&](reporting::Client& to) {
    return to.destroyReportingSession(ReporterID{reporter_id}, onBool(reply, context));
  });
}

ostrel_submission ostrel_reporter_id_valid(ostrel_client* client, int64_t reporter_id,
                                           ostrel_valid_reply reply, void* context) {
  return submit(client, [&](reporting::Client& to) {
    OnReply<reporting::ReporterValidity> handler;
    if (reply != nullptr) {
      handler = [reply, context](const Reply<reporting::ReporterValidity>& answer) {
        reply(context, statusOf(answer), static_cast<int64_t>(answer.value.reporterID),
              static_cast<uint16_t>(answer.value.serviceType));
      };
    }
    return to.reporterIDValid(ReporterID{reporter_id}, std::move(handler));
  });
}

ostrel_submission ostrel_get_all_reporters(ostrel_client* client,
                                           ostrel_reporters_reply reply, void* context) {
  return submit(client, [&](reporting::Client& to) {
    OnReply<ReporterIDs> handler;
    if (reply != nullptr) {
      handler = [reply, context](const Reply<ReporterIDs>& answer) {
        std::vector<int64_t> ids;
        for (const ReporterID id : answer.value) {
          ids.push_back(static_cast<int64_t>(id));
        }
        reply(context, statusOf(answer), ids.data(), ids.size());
      };
    }
    return to.getAllReporters(std::move(handler));
  });
}

ostrel_submission ostrel_kill_service(ostrel_client* client) {
  return submit(client, [](reporting::Client& to) { return to.killService(); });
}

ostrel_message* ostrel_message_create(void) {
  return orNull([] { return new ostrel_message; });
}
void ostrel_message_destroy(ostrel_message* message) { delete message; }

bool ostrel_message_set_text(ostrel_message* message, const char* key, const char* text) {
  return text != nullptr && set(message, key, text);
}
bool ostrel_message_set_bool(ostrel_message* message, const char* key, bool value) {
  return set(message, key, value);
}
bool ostrel_message_set_int(ostrel_message* message, const char* key, int64_t value) {
  return set(message, key, value);
}
bool ostrel_message_set_uint(ostrel_message* message, const char* key, uint64_t value) {
  return set(message, key, value);
}
bool ostrel_message_set_double(ostrel_message* message, const char* key, double value) {
  return set(message, key, value);
}
bool ostrel_message_set_date(ostrel_message* message, const char* key,
                             int64_t microseconds) {
  return set(message, key,
             reporting::Date(std::chrono::duration_cast<reporting::Date::duration>(
                 std::chrono::microseconds(microseconds))));
}
bool ostrel_message_set_list(ostrel_message* message, const char* key,
                             const ostrel_list* list) {
  return list != nullptr && set<const reporting::List&>(message, key, list->list);
}
bool ostrel_message_set_message(ostrel_message* message, const char* key,
                                const ostrel_message* value) {
  if (value == nullptr) return false;
  if (value != message) {
    return set<const reporting::Message&>(message, key, value->message);
  }
  return change(/*hasHandles=*/true, [&] {
    const reporting::Message copy = value->message;
    message->message.set(key, copy);
  });
}

ostrel_list* ostrel_list_create(void) {
  return orNull([] { return new ostrel_list; });
}
void ostrel_list_destroy(ostrel_list* list) { delete list; }

bool ostrel_list_append_text(ostrel_list* list, const char* text) {
  return text != nullptr && append(list, text);
}
bool ostrel_list_append_bool(ostrel_list* list, bool value) {
  return append(list, value);
}
bool ostrel_list_append_int(ostrel_list* list, int64_t value) {
  return append(list, value);
}
bool ostrel_list_append_uint(ostrel_list* list, uint64_t value) {
  return append(list, value);
}
bool ostrel_list_append_double(ostrel_list* list, double value) {
  return append(list, value);
}
bool ostrel_list_append_list(ostrel_list* list, const ostrel_list* value) {
  return change(list != nullptr && value != nullptr, [&] {
    const reporting::List copy = value->list;
    list->list.append(copy);
  });
}
bool ostrel_list_append_message(ostrel_list* list, const ostrel_message* value) {
  return value != nullptr && append<const reporting::Message&>(list, value->message);
}

ostrel_prepared_message* ostrel_prepared_message_create(const ostrel_message* message,
                                                        uint32_t category, uint16_t type,
                                                        const int64_t* reporter_ids,
                                                        size_t count) {
  if (message == nullptr) return nullptr;
  return orNull([&]() -> ostrel_prepared_message* {
    reporting::PreparedMessage prepared(message->message, Category{category},
                                        MessageType{type}, idsOf(reporter_ids, count));
    if (!prepared.isValid()) return nullptr;
    return new ostrel_prepared_message{std::move(prepared), {}};
  });
}

void ostrel_prepared_message_destroy(ostrel_prepared_message* message) { delete message; }

int ostrel_prepared_message_field(ostrel_prepared_message* message, const char* key) {
  int index = -1;
  change(message != nullptr && key != nullptr, [&] {
    const auto field = message->message.field(key);
    if (!field) return;
    message->fields.push_back(field);
    index = static_cast<int>(message->fields.size()) - 1;
  });
  return index;
}

void ostrel_prepared_message_set_int(ostrel_prepared_message* message, int field,
                                     int64_t value) {
  if (message != nullptr) message->message.set(fieldOf(*message, field), value);
}

void ostrel_prepared_message_set_double(ostrel_prepared_message* message, int field,
                                        double value) {
  if (message != nullptr) message->message.set(fieldOf(*message, field), value);
}

ostrel_audio_sender* ostrel_audio_sender_create(ostrel_client* client, size_t ring_bytes,
                                                uint32_t period_us) {
  if (client == nullptr) return nullptr;
  return orNull([&] {
    return new ostrel_audio_sender{
        client->client.makeAudioSender(ring_bytes, std::chrono::microseconds(period_us))};
  });
}

void ostrel_audio_sender_destroy(ostrel_audio_sender* sender) { delete sender; }

bool ostrel_audio_sender_send(ostrel_audio_sender* sender,
                              const ostrel_prepared_message* message) {
  return sender != nullptr && message != nullptr && sender->sender.send(message->message);
}

uint64_t ostrel_audio_sender_dropped(const ostrel_audio_sender* sender) {
  return sender != nullptr ? sender->sender.droppedMessages() : 0;
}

void ostrel_audio_sender_arm(ostrel_audio_sender* sender) {
  if (sender != nullptr) sender->sender.arm();
}

void ostrel_audio_sender_disarm(ostrel_audio_sender* sender) {
  if (sender != nullptr) sender->sender.disarm();
}
