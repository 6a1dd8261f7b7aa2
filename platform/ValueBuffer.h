// The memory of values: who bears it, and the buffers that values share.
#pragma once

#include <atomic>
#include <cstddef>
#include <cstdint>
#include <memory>
#include <span>
#include <utility>

namespace ostrel {

/// Bears the memory of the payloads of one client. Charged when a buffer is
/// made, relieved when its last reference goes.
class PayloadAccount {
 public:
  /// No user's.
  static constexpr std::int64_t kNobody = -1;

  virtual ~PayloadAccount() = default;

  /// The number of the user whom it is charged to in the end; `kNobody` without one.
  virtual std::int64_t user() const noexcept { return kNobody; }

  virtual void charge(std::size_t bytes) noexcept = 0;
  /// Any thread. The account may end during the call.
  virtual void relieve(std::size_t bytes) noexcept = 0;

  /// Asks for room for `bytes` that are kept beyond the message that brought
  /// them: an entry of a session's list. False: the client's share is used up,
  /// and nothing was taken. Any thread.
  virtual bool keep(std::size_t bytes) noexcept = 0;
  /// Gives back what `keep` took. Any thread.
  virtual void discard(std::size_t bytes) noexcept = 0;
  /// Whose `keep` and `discard` these are in the end, one for all accounts that have it
  /// in common; none: its own. Any thread.
  virtual std::shared_ptr<PayloadAccount> accountOfKept() noexcept { return nullptr; }

  /// Asks whether an entry of this client's may be merged into a dictionary that goes
  /// on when the message is gone. False: the entry is left out. Any thread, locks held.
  struct Merged {
    std::size_t entries;
    std::size_t bytes;
    std::size_t growth = 0;  // Of the bytes, since the merge began.
  };
  virtual bool mayMerge(const Merged& /*then*/) noexcept { return true; }
  /// Who bears such a dictionary; none: nobody. Any thread, locks held.
  virtual std::shared_ptr<PayloadAccount> accountOfMerged() noexcept { return nullptr; }
};

/// The shared bytes below values: one allocation, counted references.
class ValueBuffer {
 public:
  ValueBuffer() = default;
  /// `size` writable bytes. `account` may be none.
  static ValueBuffer make(std::size_t size, std::shared_ptr<PayloadAccount> account = {});
  static ValueBuffer copyOf(std::span<const std::uint8_t> bytes,
                            std::shared_ptr<PayloadAccount> account = {});
  /// A copy of what one read brought, and `kReadableBytes` zeros behind it. Charged are
  /// only the bytes that `charge` is told of: who reads them charges what it makes values
  /// of.
  static constexpr std::size_t kReadableBytes = 64;
  static ValueBuffer copyOfInput(std::span<const std::uint8_t> bytes,
                                 std::shared_ptr<PayloadAccount> account);

  ValueBuffer(const ValueBuffer& other) noexcept : header_(other.header_) {
    if (header_) header_->references.fetch_add(1, std::memory_order_relaxed);
  }
  ValueBuffer(ValueBuffer&& other) noexcept
      : header_(std::exchange(other.header_, nullptr)) {}
  ValueBuffer& operator=(ValueBuffer other) noexcept {
    std::swap(header_, other.header_);
    return *this;
  }
  ~ValueBuffer() {
    if (header_ && header_->references.fetch_sub(1, std::memory_order_acq_rel) == 1) {
      destroy(header_);
    }
  }

  explicit operator bool() const { return header_ != nullptr; }
  std::uint8_t* data() { return reinterpret_cast<std::uint8_t*>(header_ + 1); }
  const std::uint8_t* data() const {
    return reinterpret_cast<const std::uint8_t*>(header_ + 1);
  }
  std::size_t size() const { return header_ ? header_->size : 0; }
  const std::shared_ptr<PayloadAccount>& account() const {
    return header_ ? header_->account : kNoAccount;
  }
  /// Charges the account `bytes` more, until the last reference goes. Only who made
  /// the buffer, while holding a reference. Nothing without an account.
  void charge(std::size_t bytes) noexcept {
    if (!header_->account) return;
    header_->charged += bytes;
    header_->account->charge(bytes);
  }
  /// What the buffer takes in memory.
  std::size_t memory() const { return sizeof(Header) + header_->size; }

 private:
  struct Header {
    std::atomic<std::uint32_t> references{1};
    std::size_t size = 0;
    std::size_t charged = 0;
    std::shared_ptr<PayloadAccount> account;
  };
  static const std::shared_ptr<PayloadAccount> kNoAccount;

  static ValueBuffer makeUncharged(std::size_t size,
                                   std::shared_ptr<PayloadAccount> account);
  static void destroy(Header* header) noexcept;

  Header* header_ = nullptr;
};

}  // namespace ostrel
