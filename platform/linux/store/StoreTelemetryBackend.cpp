#include "platform/linux/store/StoreTelemetryBackend.h"

#include <sys/random.h>

#include <array>
#include <chrono>
#include <mutex>
#include <random>
#include <span>

namespace ostrel {
namespace {

constexpr std::size_t kTraceIDBytes = 16;
constexpr std::size_t kSpanIDBytes = 8;

Success successOf(std::optional<ErrorObject> error) {
  const bool succeeded = !error;
  return {succeeded, std::move(error)};
}

void fillRandom(std::span<std::uint8_t> bytes) {
  if (::getrandom(bytes.data(), bytes.size(), GRND_NONBLOCK) ==
      static_cast<ssize_t>(bytes.size())) {
    return;
  }
  // Tokens have to differ, no more.
  static std::mutex mutex;
  static std::mt19937_64 random(static_cast<std::uint64_t>(
      std::chrono::system_clock::now().time_since_epoch().count()));
  const std::lock_guard lock(mutex);
  for (std::uint8_t& byte : bytes) byte = static_cast<std::uint8_t>(random());
}

std::string randomHex(std::size_t size) {
  std::array<std::uint8_t, kTraceIDBytes> bytes{};
  const std::span<std::uint8_t> used(bytes.data(), size);
  do {
    fillRandom(used);
  } while (used[size - 1] == 0);  // All zeros are no id.
  constexpr char kDigits[] = "0123456789abcdef";
  std::string hex;
  for (const std::uint8_t byte : used) {
    hex += kDigits[byte >> 4];
    hex += kDigits[byte & 0xF];
  }
  return hex;
}

// The trace id of "00-<32 hex digits>-<16 hex digits>-<2 hex digits>".
std::optional<std::string> traceIDOf(const HierarchyToken& token) {
  constexpr std::string_view kShape =
      "00-xxxxxxxxxxxxxxxxxxxxxxxxxxxxxxxx-xxxxxxxxxxxxxxxx-xx";
  if (token.size() != kShape.size()) return std::nullopt;
  for (std::size_t i = 0; i < kShape.size(); ++i) {
    const bool isHex =
        (token[i] >= '0' && token[i] <= '9') || (token[i] >= 'a' && token[i] <= 'f');
    if (kShape[i] == 'x' ? !isHex : token[i] != kShape[i]) return std::nullopt;
  }
  std::string id = token.substr(3, 2 * kTraceIDBytes);
  if (id.find_first_not_of('0') == std::string::npos) return std::nullopt;
  return id;
}

// A completion that is called at most once and never after `release` returned.
class Discovery {
 public:
  explicit Discovery(TelemetrySession::BackendsCallback completion)
      : completion_(std::move(completion)) {}

  void answer(bool isUsable) {
    const std::lock_guard lock(mutex_);
    if (!completion_) return;
    const auto completion = std::exchange(completion_, nullptr);
    if (isUsable) {
      completion(ArrayBuilder().append(Value("store")).build());
    } else {
      completion(std::nullopt);
    }
  }

  void release() {
    const std::lock_guard lock(mutex_);
    completion_ = nullptr;
  }

 private:
  std::recursive_mutex mutex_;  // The completion may release the session.
  TelemetrySession::BackendsCallback completion_;
};

class StoreTelemetrySession final : public TelemetrySession {
 public:
  StoreTelemetrySession(std::shared_ptr<Store> store, const Dictionary& sessionInfo,
                        const Dictionary& userInfo)
      : store_(std::move(store)), session_(store_->beginSession(sessionInfo, userInfo)) {
    if (const auto id = sessionInfo.find(kTelvarSessionInfoSessionID)) {
      name_ = ostrel::description(*id);
    }
  }

  ~StoreTelemetrySession() override {
    std::vector<std::shared_ptr<Discovery>> discoveries;
    {
      const std::lock_guard lock(mutex_);
      discoveries.swap(discoveries_);
    }
    for (const auto& discovery : discoveries) discovery->release();
    store_->endSession(session_);
  }

  void startConfiguration(BackendsCallback completion) override {
    auto discovery = std::make_shared<Discovery>(std::move(completion));
    {
      const std::lock_guard lock(mutex_);
      discoveries_.push_back(discovery);
    }
    store_->whenKnown([discovery](bool isUsable) { discovery->answer(isUsable); });
  }

  Success sendMessage(std::uint16_t category, std::uint16_t type,
                      const Dictionary& payload) override {
    return successOf(store_->addMessage(session_, category, type, payload));
  }

  void flush(FlushCallback completion) override {
    store_->flush(session_, std::move(completion));
  }

  std::string description() const override { return "stored session " + name_; }

 private:
  const std::shared_ptr<Store> store_;
  StoreSession* const session_;  // The store's.
  std::string name_;
  std::mutex mutex_;
  std::vector<std::shared_ptr<Discovery>> discoveries_;  // Guarded by `mutex_`.
};

}  // namespace

StoreTelemetryBackend::StoreTelemetryBackend(std::shared_ptr<Store> store)
    : store_(std::move(store)) {}

HierarchyToken StoreTelemetryBackend::makeHierarchyToken(
    const std::optional<HierarchyToken>& parent) {
  std::optional<std::string> trace;
  if (parent) trace = traceIDOf(*parent);
  if (!trace) trace = randomHex(kTraceIDBytes);
  return "00-" + *trace + "-" + randomHex(kSpanIDBytes) + "-01";
}

std::shared_ptr<TelemetrySession> StoreTelemetryBackend::createSession(
    const Dictionary& sessionInfo, const Dictionary& userInfo,
    const std::vector<std::string>&) {
  return std::make_shared<StoreTelemetrySession>(store_, sessionInfo, userInfo);
}

Success StoreTelemetryBackend::sendOneMessage(const Dictionary& sessionInfo,
                                              const Dictionary& userInfo,
                                              std::uint16_t category, std::uint16_t type,
                                              const Dictionary& payload) {
  return successOf(
      store_->addLoneMessage({sessionInfo, userInfo, category, type, payload}));
}

}  // namespace ostrel
