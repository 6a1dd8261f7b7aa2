// Behaviours that keep all the rules of the wire and ask for too much: each operation,
// as fast and as large as it goes.
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <ctime>
#include <filesystem>

#include "platform/SpreadHashTesting.h"
#include "platform/linux/Limits.h"
#include "tests/hostile/Behaviours.h"

namespace ostrel::hostile {
namespace {

using std::chrono::milliseconds;

constexpr std::uint16_t kTelephony = 2;
constexpr std::uint16_t kAlarms = 4;
constexpr std::uint16_t kLongFormAudio = 7;

// Each behaviour has IDs of its own, but for those that take others'.
enum FirstID : std::int64_t {
  kFloodIDs = 1'000'000'000,
  kRepeatedID = 2'000'000'000,
  kEveryoneIDs = 2'100'000'000,
  kConfiguredID = 2'200'000'000,
  kStormIDs = 2'300'000'000,
  kTypeID = 2'400'000'000,
  kAlarmID = 2'500'000'000,
  kLargeID = 2'600'000'000,
  kLeavingIDs = 2'700'000'000,
  kForgingID = 2'800'000'000,
  kPlantingID = 2'900'000'000,
};

std::string oneID(std::int64_t id) { return head(Major::kArray, 1) + integer(id); }

std::string create(std::int64_t id) {
  return request(Operation::kCreateReportingSession, /*number=*/0, {integer(id)});
}
std::string start(std::int64_t id) {
  return request(Operation::kStartReportingSessionForID, /*number=*/0, {integer(id)});
}
std::string stop(std::int64_t id, std::uint64_t number) {
  return request(Operation::kStopReportingSessionForID, number, {integer(id)});
}
std::string destroy(std::int64_t id) {
  return request(Operation::kDestroyReportingSession, /*number=*/0, {integer(id)});
}
std::string setType(std::int64_t id, std::uint16_t type) {
  return request(Operation::kSetServiceType, /*number=*/0, {integer(type), integer(id)});
}
std::string configure(std::int64_t id, std::string_view key, const std::string& value) {
  return request(Operation::kSetConfiguration, /*number=*/0,
                 {head(Major::kMap, 1) + text(key) + value, integer(id)});
}
std::string send(const std::string& payload, const std::string& ids, int category = 1) {
  return request(Operation::kSendMessage, /*number=*/0,
                 {payload, integer(category), integer(2), ids});
}

std::string payloadOf(std::size_t bytes) {
  return head(Major::kMap, 1) + text("filling") + text(std::string(bytes, 'x'));
}

std::string repeated(const std::string& bytes, int count) {
  std::string all;
  for (int i = 0; i < count; ++i) all += bytes;
  return all;
}

// Sends the frames again and again, on new connections where one was cut off.
template <typename MakePeer>
void flood(Attack& attack, const std::string& frames, MakePeer makePeer) {
  while (!attack.isOver()) {
    Peer peer = makePeer();
    while (peer.sendAndDrain(frames, attack.end())) attack.step();
  }
}

// Whether the service answers on this connection now.
void expectAnswer(Attack& attack, Peer& peer) {
  if (!peer) return;
  peer.sendAndDrain(request(Operation::kReporterIDValid, /*number=*/9, {integer(-1)}),
                    Attack::patience());
  attack.expect(peer.receive(Attack::patience()).has_value(),
                "a request behind a flood was not answered");
}

// Texts that would be lines of their own in a log, or commands to a terminal.
std::string forgingFrames() {
  using namespace std::string_view_literals;
  constexpr std::string_view kForged[] = {
      "\n<3>a line of its own"sv, "\x1b[2J\x1b[31mred"sv, "%s%n%@%lli%x"sv,
      "\r\n\0<0>nul"sv,           "\xc2\x9b[31m"sv,       "\xe2\x80\xae reversed"sv};
  std::string frames;
  for (const std::string_view forged : kForged) {
    frames +=
        configure(kForgingID, "HostApplicationDisplayID", text(forged)) +
        configure(kForgingID, forged, text(forged)) +
        send(head(Major::kMap, 1) + text(forged) + text(forged), oneID(kForgingID)) +
        send(payloadOf(10), kNull) + stop(kForgingID, /*number=*/0) + start(kForgingID);
  }
  return frames;
}

// What a session log of this second would be called, for somebody who guesses.
std::string guessedLogName(std::string_view application, int secondsAhead) {
  const std::time_t when = std::time(nullptr) + secondsAhead;
  std::tm parts{};
  ::localtime_r(&when, &parts);
  std::string date(64, '\0');
  date.resize(std::strftime(date.data(), date.size(), "%Y%m%d-%H%M%S%z", &parts));
  return date + "-ostrel-" + std::string(application) + "-telephony.json";
}

}  // namespace

void floodWithSessions(Attack& attack) {
  std::int64_t id = kFloodIDs;
  while (!attack.isOver()) {
    Peer peer = attack.admitted();
    for (int burst = 0; burst < 100 && !attack.isOver(); ++burst) {
      std::string frames;
      for (int i = 0; i < 500; ++i) frames += create(id++);
      if (!peer.sendAndDrain(frames, attack.end())) break;
      attack.step();
    }
    if (!attack.isOver()) expectAnswer(attack, peer);
  }
}

void floodWithQuestions(Attack& attack) {
  const Peer owner = attack.withSessions(INT64_MIN, 1000, /*serviceType=*/1);
  flood(attack,
        repeated(request(Operation::kGetAllReporters, /*number=*/1) +
                     request(Operation::kGetServiceNameForReporterID, /*number=*/2,
                             {integer(0)}),
                 50),
        [&] { return attack.connect(); });
}

void repeatIDs(Attack& attack) {
  std::string ids = head(Major::kArray, limits::kReporterIDs);
  for (std::size_t i = 0; i < limits::kReporterIDs; ++i) ids += integer(kRepeatedID);
  flood(attack, send(payloadOf(1000), ids),
        [&] { return attack.withSessions(kRepeatedID, 1, /*serviceType=*/1); });
}

void sendToEveryone(Attack& attack) {
  flood(attack, send(payloadOf(1000), kNull),
        [&] { return attack.withSessions(kEveryoneIDs, 1000, /*serviceType=*/1); });
}

void floodWithConfigurations(Attack& attack) {
  std::uint64_t key = 0;
  const std::string value = text(std::string(1000, 'v'));
  while (!attack.isOver()) {
    Peer peer = attack.withSessions(kConfiguredID, 1, /*serviceType=*/1);
    for (;;) {
      std::string frames;
      for (int i = 0; i < 20; ++i) {
        frames += configure(kConfiguredID, "key" + std::to_string(key++), value);
      }
      if (!peer.sendAndDrain(frames, attack.end())) break;
      attack.step();
    }
  }
}

void startAndStop(Attack& attack) {
  std::string frames;
  for (std::int64_t id = kStormIDs; id < kStormIDs + 20; ++id) {
    frames += start(id) + start(id) + stop(id, /*number=*/1) + stop(id, /*number=*/1);
  }
  flood(attack, frames,
        [&] { return attack.withSessions(kStormIDs, 20, /*serviceType=*/1); });
}

void changeTypes(Attack& attack) {
  std::string frames;
  for (int i = 0; i < 20; ++i) {
    frames += setType(kTypeID, i % 2 == 0 ? kTelephony : kLongFormAudio) +
              setType(kTypeID, static_cast<std::uint16_t>(1000 + i)) +
              send(payloadOf(10), oneID(kTypeID));
  }
  flood(attack, frames, [&] { return attack.withSessions(kTypeID, 1, kTelephony); });
}

void delayAlarms(Attack& attack) {
  flood(attack, repeated(send(payloadOf(4000), oneID(kAlarmID)), 50), [&] {
    Peer peer = attack.admitted();
    // Not started: each message goes by itself, some time later.
    peer.send(create(kAlarmID) + setType(kAlarmID, kAlarms), attack.end());
    return peer;
  });
}

void sendLargeMessages(Attack& attack) {
  flood(attack, send(payloadOf(256 * 1024), oneID(kLargeID)),
        [&] { return attack.withSessions(kLargeID, 1, /*serviceType=*/1); });
}

void leaveWhileStarting(Attack& attack) {
  std::int64_t id = kLeavingIDs;
  while (!attack.isOver()) {
    Peer peer = attack.connect();
    std::string frames;
    for (int i = 0; i < 50; ++i, ++id) {
      frames += create(id) + setType(id, kTelephony) + start(id) +
                send(payloadOf(100), oneID(id));
      if (i % 2 == 0) frames += destroy(id);
      if (i % 4 == 1) frames += create(id);
    }
    peer.send(frames, attack.end());
    attack.step();
  }
}

void squatIDs(Attack& attack) {
  while (!attack.isOver()) {
    Peer peer = attack.admitted();
    std::string frames;
    // Small ones are what others choose.
    for (std::int64_t id = 1; id <= 1000; ++id) frames += create(id);
    for (std::int64_t id = 1; id <= 100; ++id) {
      frames += configure(id, "HostApplicationDisplayID", text("squatter")) + start(id) +
                stop(id, /*number=*/0) + send(payloadOf(10), oneID(id)) + destroy(id);
    }
    if (peer.sendAndDrain(frames, attack.end())) {
      attack.rest(milliseconds(20));
      attack.step();
    }
  }
}

// Whatever these meet in, each look-up there takes as long as all before it.
void chooseIDs(Attack& attack) {
  constexpr std::uint32_t kChosen = 4000;
  constexpr std::uint32_t kAtOnce = 500;
  const std::vector<std::string> keys = testing_support::meetingKeys(1000);
  std::string payload = head(Major::kMap, keys.size());
  for (const std::string& key : keys) payload += key + integer(1);
  while (!attack.isOver()) {
    Peer peer = attack.admitted();
    bool isOpen = true;
    for (std::uint32_t first = 0; isOpen && first < kChosen; first += kAtOnce) {
      std::string frames;
      std::string ids = head(Major::kArray, kAtOnce);
      for (std::uint32_t number = first; number < first + kAtOnce; ++number) {
        // Also such as are multiples of a power of two.
        const std::int64_t id = number % 2 == 0 ? testing_support::meetingID(number)
                                                : static_cast<std::int64_t>(number) << 40;
        frames += create(id) +
                  configure(id, keys[number % keys.size()].substr(1), integer(number));
        ids += integer(id);
      }
      frames += start(testing_support::meetingID(first)) + send(payload, ids);
      for (std::uint32_t number = first; number < first + kAtOnce; number += 20) {
        frames += request(Operation::kReporterIDValid, /*number=*/1,
                          {integer(testing_support::meetingID(number))});
      }
      isOpen = peer.sendAndDrain(frames, attack.end());
      attack.step();
    }
    std::string frames;
    for (std::uint32_t number = 0; number < kChosen; number += 2) {
      frames += destroy(testing_support::meetingID(number));
    }
    if (isOpen && peer.sendAndDrain(frames, attack.end())) expectAnswer(attack, peer);
  }
}

void mixOperations(Attack& attack) {
  while (!attack.isOver()) {
    Peer peer = attack.connect();
    bool isOpen = true;
    while (isOpen && !attack.isOver()) {
      std::string frames;
      for (int i = 0; i < 20; ++i) {
        // Few IDs, so that they meet; some are nobody's.
        const auto id = static_cast<std::int64_t>(attack.pick(0, 30));
        const auto number = attack.pick(0, 2);
        const auto type = static_cast<std::uint16_t>(attack.pick(0, 12));
        switch (attack.pick(1, 10)) {
          case 1:
            frames += create(id);
            break;
          case 2:
            frames += setType(id, type);
            break;
          case 3:
            frames +=
                request(Operation::kGetServiceNameForReporterID, number, {integer(id)});
            break;
          case 4:
            frames += configure(id, "key" + std::to_string(type), integer(id));
            break;
          case 5:
            frames += start(id);
            break;
          case 6:
            frames += send(payloadOf(attack.pick(0, 500)),
                           attack.pick(0, 9) == 0 ? kNull : oneID(id));
            break;
          case 7:
            frames += stop(id, number);
            break;
          case 8:
            frames += destroy(id);
            break;
          case 9:
            frames += request(Operation::kReporterIDValid, number, {integer(id)});
            break;
          default:
            frames += request(Operation::kGetAllReporters, number);
            break;
        }
      }
      isOpen = peer.sendAndDrain(frames, attack.end()) && attack.pick(0, 200) != 0;
      attack.step();
    }
  }
}

void forgeLogLines(Attack& attack) {
  flood(attack, forgingFrames(),
        [&] { return attack.withSessions(kForgingID, 1, kTelephony); });
}

void plantInTheLogDirectory(Attack& attack) {
  const std::string directory = attack.target().logDirectory;
  const std::string application = "planted";
  Peer peer = attack.withSessions(kPlantingID, 1, kTelephony);
  while (peer && !attack.isOver()) {
    if (!directory.empty()) {
      for (int ahead = 0; ahead < 3; ++ahead) {
        const std::string place = directory + '/' + guessedLogName(application, ahead);
        if (ahead == 1) {
          ::mkfifo(place.c_str(), /*mode=*/0666);
        } else {
          [[maybe_unused]] const int linked = ::symlink("../victim", place.c_str());
        }
      }
    }
    std::string frames;
    for (const std::string& name :
         {application, std::string("../../escaped"), std::string("/tmp/escaped"),
          std::string("a\0b", 3), std::string(300, 'n'), std::string(".."),
          std::string("../victim")}) {
      frames += configure(kPlantingID, "HostApplicationDisplayID", text(name)) +
                start(kPlantingID) + send(payloadOf(10), oneID(kPlantingID)) +
                stop(kPlantingID, /*number=*/0);
    }
    if (!peer.sendAndDrain(frames, attack.end())) return;
    attack.step();
    attack.rest(milliseconds(50));
  }
}

}  // namespace ostrel::hostile
