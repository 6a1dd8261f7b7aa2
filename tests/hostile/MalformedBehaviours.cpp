// Behaviours that get frames and payloads wrong. What breaks a rule must be answered by
// the end of the connection, and by nothing else.
#include <algorithm>
#include <array>

#include "platform/linux/Limits.h"
#include "platform/linux/wire/OperationTable.h"
#include "tests/hostile/Behaviours.h"

namespace ostrel::hostile {
namespace {

constexpr std::int64_t kReporter = 4711;
constexpr const char* kMustEnd = "a connection that broke the rules was not ended";
constexpr const char* kMustServe = "a request within the rules was not answered";

std::string messageFrame(std::uint64_t number, const std::string& payload) {
  return request(Operation::kSendMessage, number,
                 {payload, integer(1), integer(2), kEmptyArray});
}

std::string mapOf(std::initializer_list<std::string> items) {
  std::string map = head(Major::kMap, items.size() / 2);
  for (const std::string& item : items) map += item;
  return map;
}

// Sends it on a connection of its own; the service must end that.
void expectEnd(Attack& attack, std::string_view bytes) {
  Peer peer = attack.admitted();
  if (!peer) return;
  peer.send(bytes, Attack::patience());
  const auto first = peer.receive(Attack::patience());
  attack.expect(!first || (first->size() > 1 && (*first)[1] == 0),
                "a request that broke the rules was answered");
  attack.expect(peer.waitForEnd(Attack::patience()), kMustEnd);
  attack.step();
}

// The connection must outlive it and its reply come. Makes the connection if need be.
void expectReply(Attack& attack, Peer& peer, const std::string& bytes) {
  if (!peer) peer = attack.admitted();
  if (!peer) return;
  peer.send(bytes, Attack::patience());
  attack.expect(peer.receive(Attack::patience()).has_value(), kMustServe);
  attack.step();
}

std::vector<std::string> rightArguments(std::span<const wire::Argument> arguments) {
  std::vector<std::string> right;
  for (const wire::Argument argument : arguments) {
    switch (argument) {
      case wire::Argument::kReporterID:
        right.push_back(integer(kReporter));
        break;
      case wire::Argument::kServiceType:
      case wire::Argument::kCategory:
      case wire::Argument::kType:
        right.push_back(integer(1));
        break;
      case wire::Argument::kMessage:
      case wire::Argument::kOptionalConfiguration:
        right.push_back(kEmptyMap);
        break;
      case wire::Argument::kOptionalReporterIDs:
        right.push_back(kEmptyArray);
        break;
    }
  }
  return right;
}

const std::string kFraction("\xf9\x3e\x00", 3);
const std::string kDate("\xc1\x01", 2);
const std::string kBytes("\x41\x00", 2);
const std::string kTrue("\xf5", 1);
const std::string kUndefined("\xf7", 1);
const std::string kEndless("\x9f\xff", 2);

std::string idsOf(std::size_t count) {
  std::string ids = head(Major::kArray, count);
  for (std::size_t i = 0; i < count; ++i) ids += integer(kReporter);
  return ids;
}

// Of another type, or beyond the range.
std::vector<std::string> wrongArguments(wire::Argument argument) {
  const std::string aboveSigned = head(Major::kUnsigned, std::uint64_t{1} << 63);
  const std::string belowSigned = head(Major::kNegative, std::uint64_t{1} << 63);
  std::vector<std::string> wrong = {kFraction, kDate,      kBytes,  kTrue,
                                    text("7"), kUndefined, kEndless};
  const auto add = [&](std::initializer_list<std::string> more) {
    wrong.insert(wrong.end(), more);
  };
  switch (argument) {
    case wire::Argument::kReporterID:
      add({kNull, aboveSigned, belowSigned, kEmptyArray, kEmptyMap});
      break;
    case wire::Argument::kServiceType:
    case wire::Argument::kType:
      add({kNull, integer(-1), integer(65536), aboveSigned, kEmptyArray});
      break;
    case wire::Argument::kCategory:
      add({kNull, integer(-1), integer(4294967296), aboveSigned, kEmptyArray});
      break;
    case wire::Argument::kMessage:
      add({kNull, integer(1), kEmptyArray, mapOf({kEmptyArray, integer(1)})});
      break;
    case wire::Argument::kOptionalConfiguration:
      add({integer(1), kEmptyArray, mapOf({text("a"), kNull})});
      break;
    case wire::Argument::kOptionalReporterIDs:
      add({integer(1), kEmptyMap, head(Major::kArray, 1) + text("7"),
           head(Major::kArray, 1) + aboveSigned, head(Major::kArray, 1) + kEmptyArray,
           idsOf(limits::kReporterIDs + 1)});
      break;
  }
  return wrong;
}

std::string nested(std::size_t levels) {
  std::string payload = mapOf({text("a"), ""});
  for (std::size_t level = 1; level < levels; ++level) payload += head(Major::kArray, 1);
  return payload.replace(payload.size() - 1, 1, kEmptyArray);
}

}  // namespace

void sendGarbage(Attack& attack) {
  while (!attack.isOver()) {
    Peer peer = attack.connect();
    for (int i = 0; i < 16; ++i) {
      if (!peer.send(attack.randomBytes(attack.pick(1, 20000)), attack.end())) break;
    }
    attack.step();
  }
}

void sendRandomFrames(Attack& attack) {
  constexpr std::size_t kMostBytes = 200;
  while (!attack.isOver()) {
    Peer peer = attack.connect();
    for (int i = 0; i < 16; ++i) {
      std::string item = attack.randomBytes(attack.pick(1, kMostBytes));
      // Some get as far as an operation and its number.
      if (item.size() > 2 && attack.pick(0, 1) != 0) {
        item[0] = static_cast<char>(0x80 + attack.pick(0, 8));
        item[1] = static_cast<char>(attack.pick(0, 10));
        item[2] = static_cast<char>(attack.pick(0, 23));
      }
      if (!peer.send(frame(item), attack.end())) break;
      attack.step();
    }
  }
}

void sendMutatedFrames(Attack& attack) {
  const std::string payload =
      mapOf({text("route"), text("Speaker"), text("level"), kFraction, text("list"),
             head(Major::kArray, 2) + integer(-1) + kDate});
  std::vector<std::string> frames;
  for (const wire::OperationRow& row : wire::kOperationTable) {
    if (row.operation == Operation::kKillService) continue;
    frames.push_back(request(row.operation, /*number=*/1, rightArguments(row.arguments)));
  }
  frames.push_back(messageFrame(/*number=*/2, payload));
  while (!attack.isOver()) {
    Peer peer = attack.connect();
    for (int i = 0; i < 64; ++i) {
      std::string mutated = frames[attack.pick(0, frames.size() - 1)];
      for (auto left = attack.pick(1, 3); left > 0; --left) {
        mutated[attack.pick(wire::kFrameHeaderSize + 2, mutated.size()) - 1] =
            static_cast<char>(attack.pick(0, 255));
      }
      // The last operation ends the service, which is another behaviour.
      if (mutated[wire::kFrameHeaderSize + 1] == '\x0b') continue;
      if (!peer.sendAndDrain(mutated, attack.end())) break;
      attack.step();
    }
  }
}

void sendHalfFrames(Attack& attack) {
  const std::string whole = messageFrame(/*number=*/0, mapOf({text("a"), text("b")}));
  std::vector<Peer> kept;
  while (!attack.isOver()) {
    Peer peer = attack.connect();
    peer.send(whole.substr(0, attack.pick(1, whole.size() - 1)), attack.end());
    kept.push_back(std::move(peer));
    if (kept.size() == 32) kept.clear();
    attack.step();
  }
}

void writeOneByteAtATime(Attack& attack) {
  Peer peer = attack.admitted();
  const std::string whole =
      request(Operation::kReporterIDValid, /*number=*/1, {integer(kReporter)});
  while (peer && !attack.isOver()) {
    for (const char byte : whole) peer.send({&byte, 1}, Attack::patience());
    attack.expect(peer.receive(Attack::patience()).has_value(), kMustServe);
    attack.step();
  }
}

void sendEmptyFrames(Attack& attack) {
  while (!attack.isOver()) expectEnd(attack, lengthField(0));
}

void claimHugeFrames(Attack& attack) {
  constexpr std::uint32_t kLimit = limits::kFrameBytes;
  constexpr std::uint32_t kLengths[] = {kLimit + 1, 1u << 20, 1u << 31, UINT32_MAX};
  while (!attack.isOver()) {
    for (const std::uint32_t length : kLengths) {
      expectEnd(attack, lengthField(length) + attack.randomBytes(attack.pick(0, 100)));
    }
    // At the limit the service waits for it, and for its end.
    Peer peer = attack.admitted();
    peer.send(lengthField(kLimit) + attack.randomBytes(kLimit), Attack::patience());
    attack.expect(!peer || peer.waitForEnd(Attack::patience()), kMustEnd);
  }
}

void sendTrailingBytes(Attack& attack) {
  const std::string whole =
      request(Operation::kReporterIDValid, /*number=*/1, {integer(kReporter)});
  const std::string item = whole.substr(wire::kFrameHeaderSize);
  while (!attack.isOver()) {
    expectEnd(attack, frame(item + item));
    expectEnd(attack, frame(item + '\0'));
    expectEnd(attack, frame(item.substr(0, item.size() - 1)));
  }
}

void interleaveFrames(Attack& attack) {
  const std::string whole = messageFrame(
      /*number=*/1, mapOf({text("a"), text("0123456789012345678901234567890123456789")}));
  while (!attack.isOver()) {
    const std::size_t cut =
        attack.pick(wire::kFrameHeaderSize, wire::kFrameHeaderSize + 6);
    expectEnd(attack, whole.substr(0, cut) + whole + whole.substr(cut));
  }
}

void resetAtEveryByte(Attack& attack) {
  std::string dialogue;
  for (const wire::OperationRow& row : wire::kOperationTable) {
    if (row.operation == Operation::kKillService) continue;
    if (row.operation == Operation::kFarewell) continue;
    dialogue += request(row.operation, /*number=*/1, rightArguments(row.arguments));
  }
  dialogue += request(Operation::kFarewell, /*number=*/0).substr(0, 6);
  for (std::size_t cut = 0; !attack.isOver(); cut = (cut + 1) % dialogue.size()) {
    Peer peer = attack.connect();
    peer.send(std::string_view(dialogue).substr(0, cut), attack.end());
    // Replies that are not read make a reset of the end.
    if (attack.pick(0, 1) != 0) peer.drain();
    attack.step();
  }
}

void nestDeeply(Attack& attack) {
  Peer peer;
  while (!attack.isOver()) {
    expectReply(attack, peer, messageFrame(/*number=*/1, nested(limits::kNesting)));
    expectEnd(attack, messageFrame(/*number=*/1, nested(limits::kNesting + 1)));
    expectEnd(attack, messageFrame(/*number=*/1, nested(300'000)));
    // Not even an end.
    expectEnd(attack, frame(std::string(limits::kFrameBytes, '\x81')));
    expectEnd(attack, frame(std::string(limits::kFrameBytes, '\x9f')));
  }
}

void sendPayloadBombs(Attack& attack) {
  const auto bomb = [](std::size_t arrays) {
    // The dictionary, its key and the outer array are nodes too.
    const std::size_t inner = arrays - 3;
    return mapOf({text("a"), head(Major::kArray, inner) + std::string(inner, '\x80')});
  };
  Peer peer = attack.withSessions(kReporter, 1, /*serviceType=*/1);
  while (!attack.isOver()) {
    expectReply(attack, peer, messageFrame(/*number=*/1, bomb(limits::kNodes - 16)));
    expectEnd(attack, messageFrame(/*number=*/1, bomb(limits::kNodes + 16)));
    expectEnd(attack, messageFrame(/*number=*/1, head(Major::kMap, UINT64_MAX)));
    expectEnd(attack, messageFrame(/*number=*/1, head(Major::kMap, UINT64_MAX / 2)));
    expectEnd(attack, messageFrame(/*number=*/1, mapOf({text("a"), ""}) +
                                                     head(Major::kArray, UINT64_MAX)));
    expectEnd(attack, messageFrame(/*number=*/1, head(Major::kMap, 1) +
                                                     head(Major::kText, UINT64_MAX)));
  }
}

void repeatKeys(Attack& attack) {
  constexpr std::size_t kCount = 20'000;
  std::string payload = head(Major::kMap, kCount);
  for (std::size_t i = 0; i < kCount; ++i) payload += text("key") + integer(1);
  Peer peer;
  while (!attack.isOver()) {
    expectReply(attack, peer, messageFrame(/*number=*/1, payload));
  }
}

void collideKeys(Attack& attack) {
  // Keys of 14 characters, each a blank or a "_": all become one.
  constexpr std::size_t kBits = 14;
  std::string payload = head(Major::kMap, std::size_t{1} << kBits);
  for (std::size_t i = 0; i < std::size_t{1} << kBits; ++i) {
    std::string key(kBits, ' ');
    for (std::size_t bit = 0; bit < kBits; ++bit) {
      if ((i >> bit & 1) != 0) key[bit] = '_';
    }
    payload += text(key) + kEmptyArray;
  }
  Peer peer = attack.withSessions(kReporter, 1, /*serviceType=*/1);
  while (!attack.isOver()) {
    expectReply(attack, peer,
                request(Operation::kSendMessage, /*number=*/1,
                        {payload, integer(1), integer(2),
                         head(Major::kArray, 1) + integer(kReporter)}));
  }
}

void sendOddText(Attack& attack) {
  using namespace std::string_view_literals;
  constexpr std::string_view kOdd[] = {
      "",     " ",      "   ",          "\0"sv,  "a\0b"sv, "\n\t\x1b", "\xf0\x9f\x98\x80",
      "\x7f", "%@%s%n", "\xef\xbf\xbf", "'\";--"};
  constexpr std::string_view kNoText[] = {
      "\xff",     "\xc0\x80", "\xed\xa0\x80", "\xf5\x80\x80", "\xf4\x90\x80\x80",
      "\xe2\x82", "\x80",     "a\xc3"};
  Peer peer;
  while (!attack.isOver()) {
    for (const std::string_view odd : kOdd) {
      expectReply(attack, peer,
                  messageFrame(/*number=*/1, mapOf({text(odd), text(odd)})));
    }
    for (const std::string_view none : kNoText) {
      expectEnd(attack, messageFrame(/*number=*/1, mapOf({text(none), integer(1)})));
      expectEnd(attack, messageFrame(/*number=*/1, mapOf({text("a"), text(none)})));
    }
  }
}

void sendLongKeys(Attack& attack) {
  const auto withKey = [](std::size_t size) {
    return messageFrame(/*number=*/1, mapOf({text(std::string(size, 'k')), integer(1)}));
  };
  Peer peer;
  while (!attack.isOver()) {
    expectReply(attack, peer, withKey(limits::kKeyBytes - 1));
    expectReply(attack, peer, withKey(limits::kKeyBytes));
    expectEnd(attack, withKey(limits::kKeyBytes + 1));
    expectEnd(attack, withKey(300'000));
  }
}

void sendWrongArguments(Attack& attack) {
  while (!attack.isOver()) {
    for (const wire::OperationRow& row : wire::kOperationTable) {
      for (std::size_t i = 0; i < row.arguments.size() && !attack.isOver(); ++i) {
        for (const std::string& wrong : wrongArguments(row.arguments[i])) {
          std::vector<std::string> arguments = rightArguments(row.arguments);
          arguments[i] = wrong;
          expectEnd(attack, request(row.operation, /*number=*/1, arguments));
        }
      }
    }
  }
}

void sendWrongOperations(Attack& attack) {
  const auto call = [](const std::string& operation, const std::string& number) {
    return frame(head(Major::kArray, 3) + operation + number + integer(kReporter));
  };
  while (!attack.isOver()) {
    for (const std::string& none : {integer(12), integer(255), integer(-1), text("1"),
                                    head(Major::kUnsigned, UINT64_MAX), kNull}) {
      expectEnd(attack, call(none, integer(1)));
    }
    for (const std::string& none : {integer(-1), text("1"), kNull, kFraction}) {
      expectEnd(attack, call(integer(1), none));
    }
    for (const wire::OperationRow& row : wire::kOperationTable) {
      if (row.operation == Operation::kKillService) continue;
      std::vector<std::string> arguments = rightArguments(row.arguments);
      arguments.push_back(integer(1));
      expectEnd(attack, request(row.operation, /*number=*/1, arguments));
      if (row.arguments.empty()) continue;
      arguments.resize(arguments.size() - 2);
      expectEnd(attack, request(row.operation, /*number=*/1, arguments));
    }
    for (const std::string& item :
         {kEmptyArray, kEmptyMap, integer(1), kNull, kEndless}) {
      expectEnd(attack, frame(item));
    }
  }
}

void reuseRequestNumbers(Attack& attack) {
  Peer peer;
  while (!attack.isOver()) {
    for (const std::uint64_t number : {std::uint64_t{1}, UINT64_MAX}) {
      expectReply(attack, peer,
                  request(Operation::kReporterIDValid, number, {integer(kReporter)}));
      expectReply(attack, peer, request(Operation::kGetAllReporters, number));
      expectReply(attack, peer, messageFrame(number, kEmptyMap));
    }
  }
}

}  // namespace ostrel::hostile
