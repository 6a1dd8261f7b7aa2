#include "ostrel/OstrelReportingClient.h"

#include <utility>

#include "client/ClientCore.h"
#include "client/RequestFrame.h"

namespace ostrel::reporting {
namespace {

using wire::Operation;
using Replies = ClientCore::Replies;

// What asks for no reply holds no handler.
template <typename T>
Handler handlerOf(OnReply<T>& reply) {
  if (!reply.handler) return {};
  return std::move(reply.handler);
}

constexpr auto kNoNote = [](RestorableSessions&) {};

template <typename T, typename Note>
Submission submitForID(ClientCore& core, Operation operation, ReporterID reporterID,
                       OnReply<T>& reply, Replies replies, const Note& note) {
  return core.submit(
      operation, handlerOf(reply), replies, reply.timeout,
      [&](std::string& out, wire::RequestNumber number) {
        appendRequest(out, operation, number, reporterID);
      },
      note);
}

}  // namespace

Client::Client() : Client(Options()) {}

Client::Client(Options options)
    : core_(std::make_shared<ClientCore>(std::move(options))) {
  core_->start();
}

Client::~Client() {
  if (core_->isOfThisProcess()) {
    core_->close();
  } else {
    // Its thread is not in this process, and its lock may be held for ever.
    new std::shared_ptr<ClientCore>(std::move(core_));
  }
}

Submission Client::createReportingSession(ReporterID reporterID, OnReply<bool> reply) {
  return submitForID(*core_, Operation::kCreateReportingSession, reporterID, reply,
                     Replies::kOne,
                     [&](RestorableSessions& sessions) { sessions.create(reporterID); });
}

Submission Client::setServiceType(ServiceType serviceType, ReporterID reporterID,
                                  OnReply<bool> reply) {
  return core_->submit(
      Operation::kSetServiceType, handlerOf(reply), Replies::kOne, reply.timeout,
      [&](std::string& out, wire::RequestNumber number) {
        appendSetServiceType(out, number, serviceType, reporterID);
      },
      [&](RestorableSessions& sessions) {
        sessions.setServiceType(serviceType, reporterID);
      });
}

Submission Client::getServiceNameForReporterID(ReporterID reporterID,
                                               OnReply<ServiceType> reply) {
  const bool isAnsweredTwice = reporterID == ReporterID{0};
  return submitForID(*core_, Operation::kGetServiceNameForReporterID, reporterID, reply,
                     isAnsweredTwice ? Replies::kTwo : Replies::kOne, kNoNote);
}

Submission Client::setConfiguration(const Message& configuration, ReporterID reporterID,
                                    OnReply<bool> reply) {
  if (!configuration.isValid()) return core_->refuseInvalid();
  return core_->submit(
      Operation::kSetConfiguration, handlerOf(reply), Replies::kOne, reply.timeout,
      [&](std::string& out, wire::RequestNumber number) {
        appendSetConfiguration(out, number, configuration, reporterID);
      },
      [&](RestorableSessions& sessions) {
        sessions.setConfiguration(configuration, reporterID);
      });
}

Submission Client::startReportingSessionForID(ReporterID reporterID,
                                              OnReply<bool> reply) {
  return submitForID(*core_, Operation::kStartReportingSessionForID, reporterID, reply,
                     Replies::kMany, [&](RestorableSessions& sessions) {
                       sessions.setStarted(/*isStarted=*/true, reporterID);
                     });
}

Submission Client::sendMessage(const Message& message, Category category,
                               MessageType type,
                               const std::optional<ReporterIDs>& reporterIDs,
                               OnReply<void> reply) {
  const bool isValid =
      message.isValid() && (!reporterIDs || reporterIDs->size() <= limits::kReporterIDs);
  if (!isValid) return core_->refuseInvalid();
  return core_->submit(
      Operation::kSendMessage, handlerOf(reply), Replies::kOne, reply.timeout,
      [&](std::string& out, wire::RequestNumber number) {
        appendSendMessage(out, number, message.encoded(), category, type, reporterIDs);
      },
      kNoNote);
}

Submission Client::stopReportingSessionForID(ReporterID reporterID, OnReply<bool> reply) {
  return submitForID(*core_, Operation::kStopReportingSessionForID, reporterID, reply,
                     Replies::kOne, [&](RestorableSessions& sessions) {
                       sessions.setStarted(/*isStarted=*/false, reporterID);
                     });
}

Submission Client::destroyReportingSession(ReporterID reporterID, OnReply<bool> reply) {
  return submitForID(*core_, Operation::kDestroyReportingSession, reporterID, reply,
                     Replies::kOne,
                     [&](RestorableSessions& sessions) { sessions.destroy(reporterID); });
}

Submission Client::reporterIDValid(ReporterID reporterID,
                                   OnReply<ReporterValidity> reply) {
  return submitForID(*core_, Operation::kReporterIDValid, reporterID, reply,
                     Replies::kOne, kNoNote);
}

Submission Client::getAllReporters(OnReply<ReporterIDs> reply) {
  return submitForID(*core_, Operation::kGetAllReporters, ReporterID{0}, reply,
                     Replies::kOne, kNoNote);
}

Submission Client::killService(OnReply<bool> reply) {
  return submitForID(*core_, Operation::kKillService, ReporterID{0}, reply, Replies::kOne,
                     kNoNote);
}

AudioSender Client::makeAudioSender(std::size_t ringBytes,
                                    std::chrono::microseconds period) {
  auto ring = std::make_shared<AudioSender::Ring>(ringBytes, period, core_);
  core_->addRing(ring);
  return AudioSender(std::move(ring));
}

bool Client::flush(std::chrono::milliseconds timeout) { return core_->flush(timeout); }

void Client::close() { core_->close(); }

bool Client::isConnected() const { return core_->isConnected(); }

Counts Client::counts() const { return core_->counts(); }

AudioSender::AudioSender(std::shared_ptr<Ring> ring) : ring_(std::move(ring)) {}

AudioSender::AudioSender(AudioSender&&) noexcept = default;

AudioSender& AudioSender::operator=(AudioSender&& other) noexcept {
  if (this != &other) {
    AudioSender old(std::move(*this));
    ring_ = std::move(other.ring_);
  }
  return *this;
}

AudioSender::~AudioSender() {
  if (!ring_) return;
  ring_->isAbandoned.store(true, std::memory_order_release);
  flush();
}

bool AudioSender::send(const PreparedMessage& message) noexcept {
  if (message.isValid() && ring_->write(message.frame())) [[likely]] {
    return true;
  }
  ring_->countDrop();
  return false;
}

std::uint64_t AudioSender::droppedMessages() const noexcept { return ring_->dropped(); }

void AudioSender::arm() {
  ring_->isArmed = true;
  flush();
}

void AudioSender::disarm() {
  ring_->isArmed = false;
  flush();
}

void AudioSender::flush() {
  if (const auto core = ring_->core.lock()) core->wakeForRings();
}

}  // namespace ostrel::reporting
