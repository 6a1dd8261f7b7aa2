// What a client reports: a message with its entries, and a message laid out for
// the audio thread.
#pragma once

#include <chrono>
#include <cstddef>
#include <cstdint>
#include <initializer_list>
#include <optional>
#include <string>
#include <string_view>
#include <type_traits>
#include <unordered_set>
#include <utility>
#include <vector>

#define OSTREL_PUBLIC __attribute__((visibility("default")))

namespace ostrel::reporting {

/// Names a session; chosen by the client. 0 never names one.
enum class ReporterID : std::int64_t {};
using ReporterIDs = std::vector<ReporterID>;

/// Upper half: domain, lower half: kind.
enum class Category : std::uint32_t {};
enum class MessageType : std::uint16_t {};

enum class ServiceType : std::uint16_t {};
inline constexpr ServiceType kServiceTypeUnknown{0xFFFF};

/// A moment in time, kept to the microsecond.
using Date = std::chrono::system_clock::time_point;

class Message;
class List;

/// One value on its way into a message or a list: a boolean, an integer of 64
/// bits with or without sign, a double, a date, text (UTF-8), a list or a
/// message. Refers to text, lists and messages; meant for arguments only.
class OSTREL_PUBLIC Item {
 public:
  template <typename T, std::enable_if_t<std::is_same_v<T, bool>, int> = 0>
  Item(T value) : kind_(Kind::kBoolean), boolean_(value) {}
  template <typename T,
            std::enable_if_t<std::is_integral_v<T> && !std::is_same_v<T, bool>, int> = 0>
  Item(T value) {
    if constexpr (std::is_signed_v<T>) {
      kind_ = Kind::kSigned;
      signed_ = value;
    } else {
      kind_ = Kind::kUnsigned;
      unsigned_ = value;
    }
  }
  Item(double value) : kind_(Kind::kDouble), double_(value) {}
  Item(Date value)
      : kind_(Kind::kDate),
        double_(static_cast<double>(std::chrono::duration_cast<std::chrono::microseconds>(
                                        value.time_since_epoch())
                                        .count()) *
                1e-6) {}
  Item(std::string_view text) : kind_(Kind::kText), text_(text) {}
  Item(const std::string& text) : Item(std::string_view(text)) {}
  /// No text is empty text.
  Item(const char* text) : Item(std::string_view(text != nullptr ? text : "")) {}
  Item(const List& list) : kind_(Kind::kList), list_(&list) {}
  Item(const Message& message) : kind_(Kind::kMessage), message_(&message) {}

 private:
  friend class Collection;
  enum class Kind : std::uint8_t {
    kBoolean,
    kSigned,
    kUnsigned,
    kDouble,
    kDate,
    kText,
    kList,
    kMessage,
  };

  Kind kind_;
  union {
    bool boolean_;
    std::int64_t signed_;
    std::uint64_t unsigned_;
    double double_;
    std::string_view text_;
    const List* list_;
    const Message* message_;
  };
};

/// What lists and messages have in common.
class OSTREL_PUBLIC Collection {
 public:
  /// False once something in it can never be sent: text that is not UTF-8, a
  /// key of more than 1,024 bytes, more than 32 collections within one another,
  /// more than 65,536 values, keys included. Its size is judged when it is sent.
  bool isValid() const;

  /// Elements of a list, entries of a message.
  std::size_t size() const { return size_; }

  /// The encoding, a CBOR item.
  std::string_view encoded() const { return encoded_; }

 protected:
  explicit Collection(unsigned char majorType);

  void write(const Item& item);
  void writeText(std::string_view text);
  void writeEncoded(const Collection& part);
  void setSize(std::size_t size);
  bool isSameAs(const Item& item) const;

  std::string encoded_;
  std::size_t size_ = 0;
  std::size_t values_ = 1;
  std::size_t nesting_ = 1;
  bool isWellFormed_ = true;
};

/// An array in the making.
class OSTREL_PUBLIC List : public Collection {
 public:
  List();
  List(std::initializer_list<Item> items);

  List& append(const Item& item);
};

/// A dictionary in the making: the payload of a message, a session's
/// configuration, or a part of either.
///
///     Message message{{"route", "Speaker"}, {"channels", 2}};
///     message.set("formats", List{"pcm", "aac"});
///
/// May be sent any number of times, and copied. Not to be changed by one thread
/// while another one uses it.
class OSTREL_PUBLIC Message : public Collection {
 public:
  Message();
  Message(std::initializer_list<std::pair<std::string_view, Item>> entries);

  /// Adds an entry. A key that is there already moves to the end with its new
  /// value.
  Message& set(std::string_view key, const Item& value);

  /// Adds the entries of `other`, as `set` does. Both must be valid.
  Message& merge(const Message& other);

 private:
  struct Entry {
    std::size_t begin;
    std::size_t end;
    std::size_t values;  // With the key.
  };
  std::optional<Entry> find(std::string_view key) const;
  void makeRoomFor(std::string_view key);
  void remember(std::string_view key);

  std::uint64_t keyFilter_ = 0;           // A bit for each key, by its hash.
  std::unordered_set<std::string> keys_;  // All, once there are many.
};

/// A message with its category, type and addressees, laid out once as it
/// travels, for threads that must neither allocate nor wait. Used by one thread
/// at a time.
class OSTREL_PUBLIC PreparedMessage {
 public:
  /// A place in the message whose number can be changed. The default one is
  /// nowhere.
  class Field {
   public:
    Field() = default;
    explicit operator bool() const { return index_ != kNowhere; }

   private:
    friend class PreparedMessage;
    static constexpr std::size_t kNowhere = static_cast<std::size_t>(-1);
    std::size_t index_ = kNowhere;
  };

  /// `reporterIDs` as in `Client::sendMessage`.
  PreparedMessage(const Message& message, Category category, MessageType type,
                  const std::optional<ReporterIDs>& reporterIDs);

  /// Gives the number or date at `key` room for any other. Nowhere when the
  /// message has no number or date there. Allocates: to be called while
  /// preparing. Fields named before stay good.
  Field field(std::string_view key);

  /// Changes a number; its kind may change with it. In a date it counts the
  /// seconds since 1970. Nothing happens to a field that is nowhere. `field`
  /// must be one of this message or of one that this is a copy of. No
  /// allocation, no system call.
  void set(Field field, double value) noexcept;
  void set(Field field, Date value) noexcept;
  template <typename T, std::enable_if_t<std::is_integral_v<T>, int> = 0>
  void set(Field field, T value) noexcept {
    if constexpr (std::is_signed_v<T>) {
      setSigned(field, value);
    } else {
      setUnsigned(field, value);
    }
  }

  /// False when it can never be sent: see `Collection::isValid`; also with more
  /// than 1,024 IDs, or with more than 320 KiB in all.
  bool isValid() const { return isValid_; }

  /// The request as it travels.
  std::string_view frame() const { return frame_; }

 private:
  void setSigned(Field field, std::int64_t value) noexcept;
  void setUnsigned(Field field, std::uint64_t value) noexcept;
  void write(Field field, unsigned char head, std::uint64_t bits) noexcept;

  std::string frame_;
  std::size_t payload_ = 0;           // Where the message begins in the frame.
  std::vector<std::size_t> offsets_;  // Of the fields' numbers in the frame.
  bool isValid_ = false;
};

}  // namespace ostrel::reporting
