#pragma once

#include <functional>
#include <string>
#include <utility>
#include <vector>

#include "client/ServiceConnection.h"

namespace ostrel {

/// A connection whose service is the test: it keeps the requests, and the test
/// answers them.
class FakeServiceConnection final : public ServiceConnection {
 public:
  /// Each call as text, "close" and "abort" too.
  std::vector<std::string> calls;
  // The replies that were handed in, in order.
  std::vector<BoolReply> boolReplies;
  std::vector<ServiceTypeReply> serviceTypeReplies;
  std::vector<ErrorReply> errorReplies;
  std::vector<DictionaryReply> dictionaryReplies;
  std::vector<ReporterIDsReply> reporterIDsReplies;
  std::function<void(std::string)> closedHandler;
  /// Called at each request, after it was kept.
  std::function<void()> onRequest = [] {};

  void setClosedHandler(std::function<void(std::string reason)> handler) override {
    closedHandler = std::move(handler);
  }
  void close() override { calls.push_back("close"); }
  void abort() override { calls.push_back("abort"); }

  void createReportingSession(ReporterID id, BoolReply reply) override {
    keep(boolReplies, std::move(reply), "createReportingSession " + text(id));
  }
  void setServiceType(ServiceType type, ReporterID id, BoolReply reply) override {
    keep(
        boolReplies, std::move(reply),
        "setServiceType " + std::to_string(static_cast<unsigned>(type)) + " " + text(id));
  }
  void getServiceNameForReporterID(ReporterID id, ServiceTypeReply reply) override {
    keep(serviceTypeReplies, std::move(reply), "getServiceNameForReporterID " + text(id));
  }
  void setConfiguration(std::optional<Dictionary> configuration, ReporterID id,
                        BoolReply reply) override {
    keep(boolReplies, std::move(reply),
         "setConfiguration " + (configuration ? description(*configuration) : "none") +
             " " + text(id));
  }
  void startReportingSessionForID(ReporterID id, BoolReply reply) override {
    keep(boolReplies, std::move(reply), "startReportingSessionForID " + text(id));
  }
  void sendMessage(Dictionary message, MessageCategory category, MessageType type,
                   std::optional<ReporterIDs> ids, ErrorReply reply) override {
    lastMessage = message;
    std::string call = "sendMessage " + description(message) + " " +
                       std::to_string(static_cast<std::uint32_t>(category)) + " " +
                       std::to_string(static_cast<unsigned>(type));
    if (ids) {
      call += " [";
      for (const ReporterID id : *ids) call += text(id) + ",";
      call += "]";
    }
    keep(errorReplies, std::move(reply), call);
  }
  void stopReportingSessionForID(ReporterID id, BoolReply reply) override {
    keep(boolReplies, std::move(reply), "stopReportingSessionForID " + text(id));
  }
  void destroyReportingSession(ReporterID id, BoolReply reply) override {
    keep(boolReplies, std::move(reply), "destroyReportingSession " + text(id));
  }
  void reporterIDValid(ReporterID id, DictionaryReply reply) override {
    keep(dictionaryReplies, std::move(reply), "reporterIDValid " + text(id));
  }
  void getAllReporters(ReporterIDsReply reply) override {
    keep(reporterIDsReplies, std::move(reply), "getAllReporters");
  }
  void killService(BoolReply reply) override {
    keep(boolReplies, std::move(reply), "killService");
  }

  std::optional<Dictionary> lastMessage;

 private:
  static std::string text(ReporterID id) {
    return std::to_string(static_cast<std::int64_t>(id));
  }
  template <typename Reply>
  void keep(std::vector<Reply>& replies, Reply reply, std::string call) {
    replies.push_back(std::move(reply));
    calls.push_back(std::move(call));
    onRequest();
  }
};

}  // namespace ostrel
