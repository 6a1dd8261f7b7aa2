// Behaviours that misuse connections: too many, never read, never ended, shared.
#include <signal.h>
#include <sys/prctl.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

#include <array>
#include <cstring>

#include "platform/linux/Limits.h"
#include "tests/hostile/Behaviours.h"

namespace ostrel::hostile {
namespace {

using std::chrono::milliseconds;

constexpr std::int64_t kReporter = 815;

// Answered by some 10 KiB.
constexpr int kManySessions = 1000;
constexpr std::int64_t kFirstLongID = INT64_MAX - 1'000'000;

std::string question(std::uint64_t number) {
  return request(Operation::kGetAllReporters, number);
}

std::string repeated(const std::string& bytes, int count) {
  std::string all;
  for (int i = 0; i < count; ++i) all += bytes;
  return all;
}

bool sendWithDescriptors(const Peer& peer, const std::string& bytes, std::size_t count) {
  constexpr std::size_t kMost = 250;
  std::array<int, kMost> passed;
  passed.fill(peer.descriptor());
  iovec place{const_cast<char*>(bytes.data()), bytes.size()};
  alignas(cmsghdr) std::array<char, CMSG_SPACE(kMost * sizeof(int))> control{};
  msghdr message{};
  message.msg_iov = &place;
  message.msg_iovlen = 1;
  message.msg_control = control.data();
  message.msg_controllen = CMSG_SPACE(count * sizeof(int));
  cmsghdr* header = CMSG_FIRSTHDR(&message);
  header->cmsg_level = SOL_SOCKET;
  header->cmsg_type = SCM_RIGHTS;
  header->cmsg_len = CMSG_LEN(count * sizeof(int));
  std::memcpy(CMSG_DATA(header), passed.data(), count * sizeof(int));
  return ::sendmsg(peer.descriptor(), &message, MSG_NOSIGNAL) >= 0;
}

// Runs `step` in a child, which then becomes another program with what it holds.
template <typename Step>
void inAChildThatExecs(const Step& step) {
  const pid_t child = ::fork();
  if (child == 0) {
    step();
    ::execlp("sleep", "sleep", "0.05", nullptr);
    ::_exit(EXIT_FAILURE);
  }
  ::waitpid(child, nullptr, 0);
}

}  // namespace

void passDescriptors(Attack& attack) {
  while (!attack.isOver()) {
    for (const std::size_t count : {1u, 2u, 250u}) {
      Peer peer = attack.admitted();
      if (!peer) return;
      sendWithDescriptors(peer, question(/*number=*/1), count);
      attack.expect(peer.waitForEnd(Attack::patience()),
                    "a client that passed descriptors was not cut off");
      attack.step();
    }
  }
}

void neverRead(Attack& attack) {
  const Peer owner = attack.withSessions(kFirstLongID, kManySessions, /*serviceType=*/1);
  const std::string questions = repeated(question(/*number=*/1), 1000);
  std::vector<Peer> peers;
  std::size_t next = 0;
  while (!attack.isOver()) {
    if (peers.size() < 200) {
      peers.push_back(attack.connect());
      next = peers.size() - 1;
    }
    // Held back or cut off: on with the next.
    if (!peers[next].send(questions, Clock::now() + milliseconds(1)) &&
        attack.pick(0, 3) == 0) {
      peers[next] = attack.connect();
    }
    next = (next + 1) % peers.size();
    attack.step();
  }
}

void readSlowly(Attack& attack) {
  const Peer owner = attack.withSessions(kFirstLongID, kManySessions, /*serviceType=*/1);
  std::vector<Peer> peers;
  for (int i = 0; i < 20; ++i) peers.push_back(attack.connect());
  while (!attack.isOver()) {
    for (Peer& peer : peers) {
      char byte = 0;
      [[maybe_unused]] const ssize_t count =
          ::recv(peer.descriptor(), &byte, sizeof byte, MSG_DONTWAIT);
      const bool isOpen =
          peer.send(repeated(question(/*number=*/1), 10), Clock::now() + milliseconds(1));
      if (!isOpen && attack.pick(0, 20) == 0) peer = attack.connect();
      attack.step();
    }
  }
}

void shutDownHalf(Attack& attack) {
  const std::string questions = repeated(question(/*number=*/1), 20);
  while (!attack.isOver()) {
    Peer mute = attack.connect();
    mute.send(questions, attack.end());
    mute.shutDown(SHUT_WR);
    attack.expect(!mute || mute.waitForEnd(Attack::patience()),
                  "a client that stopped writing was not let go");
    Peer deaf = attack.connect();
    deaf.shutDown(SHUT_RD);
    deaf.send(questions, attack.end());
    attack.step();
  }
}

void openAndDrop(Attack& attack) {
  constexpr std::uint64_t kWanted = 20'000;
  while (!attack.isOver() && attack.steps() < kWanted) {
    Peer peer = attack.connect();
    attack.step();
  }
}

void holdAllConnections(Attack& attack) {
  while (!attack.isOver()) {
    std::vector<Peer> peers;
    const TimePoint end = Clock::now() + std::chrono::seconds(2);
    while (!attack.isOver() && Clock::now() < end) {
      if (peers.size() <= limits::kConnections) {
        peers.push_back(attack.connect());
        // Some say something first and are quiet then.
        if (peers.size() % 2 == 0) peers.back().send(question(0), attack.end());
        attack.step();
      } else {
        attack.rest(milliseconds(20));
      }
    }
    peers.clear();
    attack.rest(milliseconds(500));
  }
}

void hoardHalfFrames(Attack& attack) {
  const std::string most =
      lengthField(limits::kFrameBytes) + std::string(limits::kFrameBytes - 1, '\x81');
  std::vector<Peer> peers;
  while (!attack.isOver()) {
    if (peers.size() == 1000) {
      attack.rest(milliseconds(100));
      continue;
    }
    peers.push_back(attack.connect());
    peers.back().send(most, Clock::now() + milliseconds(20));
    attack.step();
  }
}

void dribble(Attack& attack) {
  const std::string endless = lengthField(limits::kFrameBytes);
  std::vector<Peer> peers;
  for (int i = 0; i < 100; ++i) peers.push_back(attack.connect());
  for (std::size_t at = 0; !attack.isOver(); ++at) {
    for (Peer& peer : peers) {
      const char byte = at < endless.size() ? endless[at] : '\x81';
      if (!peer.send({&byte, 1}, attack.end())) peer = attack.connect();
      attack.step();
    }
    attack.rest(milliseconds(50));
  }
}

void forkWithTheSocket(Attack& attack) {
  while (!attack.isOver()) {
    Peer peer = attack.connect();
    inAChildThatExecs([&] {
      // The socket stays open in the program that comes.
      const int kept = ::dup(peer.descriptor());
      peer.send(question(/*number=*/1), attack.end());
      [[maybe_unused]] const ssize_t count =
          ::send(kept, "\x02", 1, MSG_NOSIGNAL | MSG_DONTWAIT);
    });
    peer.send(std::string("\0\0\0\x82\x0a", 5), attack.end());
    attack.step();
  }
}

void takeOddProcessNames(Attack& attack) {
  constexpr const char* kNames[] = {"a\n<3>forged",    "\x1b[31mred", "%@%s%n%x",
                                    "\xff\xfe\xfd",    "  ",          "",
                                    "a\rb\tc\x7f\x80", "'; DROP"};
  while (!attack.isOver()) {
    for (const char* name : kNames) {
      const pid_t child = ::fork();
      if (child == 0) {
        ::prctl(PR_SET_NAME, name);
        Peer peer = attack.connect();
        peer.send(question(/*number=*/1), attack.end());
        peer.receive(attack.end());
        ::_exit(EXIT_SUCCESS);
      }
      ::waitpid(child, nullptr, 0);
      attack.step();
    }
  }
}

void killTheService(Attack& attack) {
  while (!attack.isOver()) {
    Peer peer = attack.withSessions(kReporter, 10, /*serviceType=*/2);
    peer.send(repeated(request(Operation::kSendMessage, /*number=*/1,
                               {kEmptyMap, integer(1), integer(2), kNull}),
                       100) +
                  request(Operation::kKillService, /*number=*/2),
              attack.end());
    attack.expect(!peer || peer.waitForEnd(Attack::patience()),
                  "the service did not end when it was told to");
    attack.step();
  }
}

void stayWhileItEnds(Attack& attack) {
  std::vector<Peer> peers;
  for (int i = 0; i < 20; ++i) {
    peers.push_back(attack.withSessions(kReporter + i * 100, 50, /*serviceType=*/1));
    peers.push_back(attack.connect());  // Idle.
    peers.push_back(attack.connect());  // Halfway in a frame.
    peers.back().send(lengthField(1000), attack.end());
    peers.push_back(attack.connect());  // Answers unread.
    peers.back().send(repeated(question(/*number=*/1), 1000),
                      Clock::now() + milliseconds(5));
  }
  const std::string message = request(Operation::kSendMessage, /*number=*/0,
                                      {kEmptyMap, integer(1), integer(2), kNull});
  while (!attack.isOver() && peers.front().send(message, attack.end())) attack.step();
}

}  // namespace ostrel::hostile
