// A telemetry backend and conditions for storms.
#pragma once

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <deque>
#include <functional>
#include <memory>
#include <mutex>
#include <random>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include "platform/Condition.h"
#include "platform/fake/FakeTelemetryBackend.h"

namespace ostrel {

/// The fake backend, whose discoveries are answered by three threads of this one's, or on
/// the caller: with a list, an empty list or none, once or twice, soon or late or never.
/// As it must, it answers no session that was released.
class AnsweringBackend final : public TelemetryBackend {
 public:
  AnsweringBackend(std::shared_ptr<FakeTelemetryBackend> fake, unsigned seed)
      : fake_(std::move(fake)), dice_(seed) {
    fake_->setDiscovery(FakeDiscovery::held());
    for (int i = 0; i < kThreads; ++i) threads_.emplace_back([this] { run(); });
  }
  ~AnsweringBackend() override { end(); }

  /// Gives all answers that are left, and then no more.
  void end() {
    {
      const std::lock_guard lock(mutex_);
      isEnding_ = true;
    }
    changed_.notify_all();
    for (std::thread& thread : threads_) {
      if (thread.joinable()) thread.join();
    }
  }

  HierarchyToken makeHierarchyToken(
      const std::optional<HierarchyToken>& parent) override {
    return fake_->makeHierarchyToken(parent);
  }

  std::shared_ptr<TelemetrySession> createSession(
      const Dictionary& sessionInfo, const Dictionary& userInfo,
      const std::vector<std::string>& frameworksToCheck) override {
    const std::lock_guard lock(making_);
    auto handle = fake_->createSession(sessionInfo, userInfo, frameworksToCheck);
    auto seat = std::make_shared<Seat>();
    seat->session = fake_->lastSession();
    return std::make_shared<Handle>(*this, std::move(handle), std::move(seat));
  }

  Success sendOneMessage(const Dictionary& sessionInfo, const Dictionary& userInfo,
                         std::uint16_t category, std::uint16_t type,
                         const Dictionary& payload) override {
    return fake_->sendOneMessage(sessionInfo, userInfo, category, type, payload);
  }

 private:
  static constexpr int kThreads = 3;

  /// A telemetry session that an answer may be under way to.
  struct Seat {
    std::mutex mutex;
    bool isReleased = false;
    std::shared_ptr<FakeTelemetrySession> session;
    std::atomic<int> answersLeft{0};

    void answer(const std::optional<Array>& backends) {
      {
        const std::lock_guard lock(mutex);
        if (!isReleased) session->answerDiscovery(backends);
      }
      // The last answer lets go of the completion, and perhaps of all that is behind it.
      if (--answersLeft == 0) session->forgetDiscovery();
    }
  };

  class Handle final : public TelemetrySession {
   public:
    Handle(AnsweringBackend& backend, std::shared_ptr<TelemetrySession> fake,
           std::shared_ptr<Seat> seat)
        : backend_(backend), fake_(std::move(fake)), seat_(std::move(seat)) {}
    ~Handle() override {
      {
        const std::lock_guard lock(seat_->mutex);
        seat_->isReleased = true;
      }
      seat_->session->forgetDiscovery();
    }

    void startConfiguration(BackendsCallback completion) override {
      fake_->startConfiguration(std::move(completion));
      backend_.script(seat_);
    }
    Success sendMessage(std::uint16_t category, std::uint16_t type,
                        const Dictionary& payload) override {
      return fake_->sendMessage(category, type, payload);
    }
    void flush(FlushCallback completion) override { fake_->flush(std::move(completion)); }
    std::string description() const override { return fake_->description(); }

   private:
    AnsweringBackend& backend_;
    const std::shared_ptr<TelemetrySession> fake_;
    const std::shared_ptr<Seat> seat_;
  };

  void script(const std::shared_ptr<Seat>& seat) {
    const Array list = ArrayBuilder().append(Value("embedded")).build();
    switch (roll(/*sides=*/9)) {
      case 0:
        seat->answersLeft = 1;
        seat->answer(list);  // On the caller.
        break;
      case 1:
        answerSoon(seat, {Array()});
        break;
      case 2:
        answerSoon(seat, {std::nullopt});
        break;
      case 3:  // Perhaps at once, from two threads.
        answerSoon(seat, {list, list});
        break;
      case 4:
        answerSoon(seat, {std::nullopt, list});
        break;
      case 5:  // Perhaps after the wait.
        seat->answersLeft = 1;
        add([seat, list] {
          std::this_thread::sleep_for(std::chrono::milliseconds(4));
          seat->answer(list);
        });
        break;
      case 6:  // Never.
        break;
      default:
        answerSoon(seat, {list});
    }
  }

  void answerSoon(const std::shared_ptr<Seat>& seat,
                  const std::vector<std::optional<Array>>& answers) {
    seat->answersLeft = static_cast<int>(answers.size());
    for (const auto& backends : answers) {
      add([seat, backends] { seat->answer(backends); });
    }
  }

  int roll(int sides) {
    const std::lock_guard lock(mutex_);
    return static_cast<int>(dice_() % static_cast<unsigned>(sides));
  }

  void add(std::function<void()> work) {
    const std::lock_guard lock(mutex_);
    work_.push_back(std::move(work));
    changed_.notify_one();
  }

  void run() {
    std::unique_lock lock(mutex_);
    for (;;) {
      changed_.wait(lock, [this] { return isEnding_ || !work_.empty(); });
      if (work_.empty()) return;
      auto work = std::move(work_.front());
      work_.pop_front();
      lock.unlock();
      work();
      work = nullptr;
      lock.lock();
    }
  }

  const std::shared_ptr<FakeTelemetryBackend> fake_;
  std::mutex making_;

  std::mutex mutex_;  // Of what follows.
  std::condition_variable changed_;
  std::mt19937 dice_;
  std::deque<std::function<void()>> work_;
  bool isEnding_ = false;

  std::vector<std::thread> threads_;
};

/// Conditions that time out 1800 times as soon: a wait for backends takes 5 ms.
class HastyConditions final : public ConditionFactory {
 public:
  explicit HastyConditions(std::shared_ptr<ConditionFactory> conditions)
      : conditions_(std::move(conditions)) {}

  std::shared_ptr<Condition> makeCondition() override {
    return std::make_shared<Hasty>(conditions_->makeCondition());
  }

 private:
  class Hasty final : public Condition {
   public:
    explicit Hasty(std::shared_ptr<Condition> condition)
        : condition_(std::move(condition)) {}

    void lock() OSTREL_ACQUIRE() OSTREL_NO_THREAD_SAFETY_ANALYSIS override {
      condition_->lock();
    }
    void unlock() OSTREL_RELEASE() OSTREL_NO_THREAD_SAFETY_ANALYSIS override {
      condition_->unlock();
    }
    void wait(std::chrono::nanoseconds timeout, Waiter waiter)
        OSTREL_REQUIRES(this) OSTREL_NO_THREAD_SAFETY_ANALYSIS override {
      condition_->wait(timeout / 1800, std::move(waiter));
    }
    void signal() OSTREL_REQUIRES(this) OSTREL_NO_THREAD_SAFETY_ANALYSIS override {
      condition_->signal();
    }

   private:
    const std::shared_ptr<Condition> condition_;
  };

  const std::shared_ptr<ConditionFactory> conditions_;
};

}  // namespace ostrel
