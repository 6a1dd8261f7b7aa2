#include "platform/fake/FakeTelemetryBackend.h"

#include <utility>

#include "platform/fake/FakeUse.h"

namespace ostrel {
namespace {

Array embedded() { return ArrayBuilder().append(Value("embedded")).build(); }

Success takeScripted(std::deque<Success>& results) {
  if (results.empty()) return {true, std::nullopt};
  Success result = std::move(results.front());
  results.pop_front();
  return result;
}

std::string codes(std::uint16_t category, std::uint16_t type) {
  return std::to_string(category) + ' ' + std::to_string(type);
}

}  // namespace

FakeDiscovery FakeDiscovery::found() { return {When::kInline, embedded(), /*times=*/1}; }
FakeDiscovery FakeDiscovery::foundTwice() {
  return {When::kInline, embedded(), /*times=*/2};
}

struct FakeTelemetryBackend::Shared {
  SharedEventLog events;

  std::mutex mutex;
  FakeDiscovery discovery = FakeDiscovery::found();
  FakeFlush flush;
  std::deque<Success> sendResults;
  std::deque<Success> sendOneResults;
  std::function<void(const FakeTelemetryMessage&)> onSend;
  std::vector<std::shared_ptr<FakeTelemetrySession>> sessions;
  std::vector<SingleMessage> singleMessages;
  int tokenCount = 0;
};

/// What the service holds: releasing it ends the session.
class FakeTelemetrySessionHandle final : public TelemetrySession {
 public:
  FakeTelemetrySessionHandle(std::shared_ptr<FakeTelemetryBackend::Shared> shared,
                             std::shared_ptr<FakeTelemetrySession> session)
      : shared_(std::move(shared)), session_(std::move(session)) {}

  ~FakeTelemetrySessionHandle() override {
    shared_->events->add("backend.release " + numberText());
    const std::lock_guard lock(session_->mutex_);
    session_->isReleased_ = true;
  }

  void startConfiguration(BackendsCallback completion) override {
    checkFakeUse(completion != nullptr, "discovery has a completion");
    shared_->events->add("backend.startConfiguration " + numberText());
    const FakeDiscovery discovery = [&] {
      const std::lock_guard lock(shared_->mutex);
      return shared_->discovery;
    }();
    {
      const std::lock_guard lock(session_->mutex_);
      checkFakeUse(!session_->discovery_, "a session is configured once");
      session_->discovery_ = completion;
    }
    if (discovery.when == FakeDiscovery::When::kHeld) return;
    for (int i = 0; i < discovery.times; ++i) completion(discovery.backends);
  }

  Success sendMessage(std::uint16_t category, std::uint16_t type,
                      const Dictionary& payload) override {
    shared_->events->add(
        "backend.sendMessage " + numberText() + ' ' + codes(category, type),
        {payload.value()});
    const FakeTelemetryMessage message{category, type, payload};
    {
      const std::lock_guard lock(session_->mutex_);
      session_->messages_.push_back(message);
    }
    std::function<void(const FakeTelemetryMessage&)> onSend;
    Success result;
    {
      const std::lock_guard lock(shared_->mutex);
      onSend = shared_->onSend;
      result = takeScripted(shared_->sendResults);
    }
    if (onSend) onSend(message);
    return result;
  }

  void flush(FlushCallback completion) override {
    checkFakeUse(completion != nullptr, "a flush has a completion");
    shared_->events->add("backend.flush " + numberText());
    const FakeFlush answer = [&] {
      const std::lock_guard lock(shared_->mutex);
      return shared_->flush;
    }();
    {
      const std::lock_guard lock(session_->mutex_);
      ++session_->flushCount_;
      if (answer.isHeld) {
        session_->flushes_.push_back(std::move(completion));
        return;
      }
    }
    completion(answer.error);
  }

  std::string description() const override { return "fake session " + numberText(); }

 private:
  std::string numberText() const { return std::to_string(session_->number_); }

  const std::shared_ptr<FakeTelemetryBackend::Shared> shared_;
  const std::shared_ptr<FakeTelemetrySession> session_;
};

std::vector<FakeTelemetryMessage> FakeTelemetrySession::messages() const {
  const std::lock_guard lock(mutex_);
  return messages_;
}

std::size_t FakeTelemetrySession::flushCount() const {
  const std::lock_guard lock(mutex_);
  return flushCount_;
}

bool FakeTelemetrySession::isReleased() const {
  const std::lock_guard lock(mutex_);
  return isReleased_;
}

bool FakeTelemetrySession::isDiscovering() const {
  const std::lock_guard lock(mutex_);
  return discovery_ != nullptr;
}

void FakeTelemetrySession::answerDiscovery(std::optional<Array> backends) {
  if (isReleased()) return;
  answerDiscoveryDespiteRelease(std::move(backends));
}

void FakeTelemetrySession::answerDiscoveryDespiteRelease(std::optional<Array> backends) {
  const TelemetrySession::BackendsCallback completion = [&] {
    const std::lock_guard lock(mutex_);
    return discovery_;
  }();
  checkFakeUse(completion != nullptr, "there is a discovery to answer");
  completion(std::move(backends));
}

void FakeTelemetrySession::forgetDiscovery() {
  TelemetrySession::BackendsCallback dropped;  // Destroyed without the lock.
  const std::lock_guard lock(mutex_);
  dropped.swap(discovery_);
}

bool FakeTelemetrySession::hasHeldFlush() const {
  const std::lock_guard lock(mutex_);
  return !flushes_.empty();
}

void FakeTelemetrySession::answerFlush(std::optional<ErrorObject> error) {
  const TelemetrySession::FlushCallback completion = [&] {
    const std::lock_guard lock(mutex_);
    checkFakeUse(!flushes_.empty(), "there is a held flush to answer");
    auto oldest = std::move(flushes_.front());
    flushes_.pop_front();
    return oldest;
  }();
  completion(std::move(error));
}

FakeTelemetryBackend::FakeTelemetryBackend(SharedEventLog events)
    : shared_(std::make_shared<Shared>()) {
  shared_->events = std::move(events);
}

HierarchyToken FakeTelemetryBackend::makeHierarchyToken(
    const std::optional<HierarchyToken>& parent) {
  shared_->events->add("backend.makeHierarchyToken");
  const std::lock_guard lock(shared_->mutex);
  const std::string token = "token-" + std::to_string(++shared_->tokenCount);
  return parent ? *parent + '/' + token : token;
}

std::shared_ptr<TelemetrySession> FakeTelemetryBackend::createSession(
    const Dictionary& sessionInfo, const Dictionary& userInfo,
    const std::vector<std::string>& frameworksToCheck) {
  const auto session = std::make_shared<FakeTelemetrySession>();
  session->sessionInfo_ = sessionInfo;
  session->userInfo_ = userInfo;
  session->frameworks_ = frameworksToCheck;
  {
    const std::lock_guard lock(shared_->mutex);
    shared_->sessions.push_back(session);
    session->number_ = static_cast<int>(shared_->sessions.size());
  }
  shared_->events->add("backend.createSession " + std::to_string(session->number_),
                       {sessionInfo.value(), userInfo.value()});
  return std::make_shared<FakeTelemetrySessionHandle>(shared_, session);
}

Success FakeTelemetryBackend::sendOneMessage(const Dictionary& sessionInfo,
                                             const Dictionary& userInfo,
                                             std::uint16_t category, std::uint16_t type,
                                             const Dictionary& payload) {
  shared_->events->add("backend.sendOneMessage " + codes(category, type),
                       {sessionInfo.value(), userInfo.value(), payload.value()});
  const std::lock_guard lock(shared_->mutex);
  shared_->singleMessages.push_back({sessionInfo, userInfo, category, type, payload});
  return takeScripted(shared_->sendOneResults);
}

void FakeTelemetryBackend::setDiscovery(FakeDiscovery discovery) {
  const std::lock_guard lock(shared_->mutex);
  shared_->discovery = std::move(discovery);
}

void FakeTelemetryBackend::setFlush(FakeFlush flush) {
  const std::lock_guard lock(shared_->mutex);
  shared_->flush = std::move(flush);
}

void FakeTelemetryBackend::scriptSend(Success result) {
  const std::lock_guard lock(shared_->mutex);
  shared_->sendResults.push_back(std::move(result));
}

void FakeTelemetryBackend::scriptSendOne(Success result) {
  const std::lock_guard lock(shared_->mutex);
  shared_->sendOneResults.push_back(std::move(result));
}

void FakeTelemetryBackend::setOnSend(
    std::function<void(const FakeTelemetryMessage&)> action) {
  const std::lock_guard lock(shared_->mutex);
  shared_->onSend = std::move(action);
}

std::size_t FakeTelemetryBackend::sessionCount() const {
  const std::lock_guard lock(shared_->mutex);
  return shared_->sessions.size();
}

std::shared_ptr<FakeTelemetrySession> FakeTelemetryBackend::session(
    std::size_t number) const {
  const std::lock_guard lock(shared_->mutex);
  checkFakeUse(number >= 1 && number <= shared_->sessions.size(),
               "the telemetry session was made");
  return shared_->sessions[number - 1];
}

std::shared_ptr<FakeTelemetrySession> FakeTelemetryBackend::lastSession() const {
  return session(sessionCount());
}

std::vector<FakeTelemetryBackend::SingleMessage> FakeTelemetryBackend::singleMessages()
    const {
  const std::lock_guard lock(shared_->mutex);
  return shared_->singleMessages;
}

void FakeTelemetryBackend::releaseCallbacks() {
  std::vector<std::shared_ptr<FakeTelemetrySession>> sessions;
  std::function<void(const FakeTelemetryMessage&)> onSend;
  {
    const std::lock_guard lock(shared_->mutex);
    sessions = shared_->sessions;
    onSend.swap(shared_->onSend);
  }
  for (const auto& session : sessions) {
    TelemetrySession::BackendsCallback discovery;  // Destroyed without the lock.
    std::deque<TelemetrySession::FlushCallback> flushes;
    const std::lock_guard lock(session->mutex_);
    discovery.swap(session->discovery_);
    flushes.swap(session->flushes_);
  }
}

}  // namespace ostrel
