#pragma once

#include <ostream>
#include <span>
#include <string_view>

#include "tests/hostile/Attack.h"

namespace ostrel::hostile {

struct Behaviour {
  std::string_view name;
  std::string_view sentence;
  /// Goes on until the attack is over, or until it has done what it does once.
  void (*run)(Attack& attack);
  /// The service ends by it: it gets one of its own.
  bool endsTheService = false;

  friend std::ostream& operator<<(std::ostream& out, const Behaviour& behaviour) {
    return out << behaviour.name;
  }
};

std::span<const Behaviour> behaviours();

// By what they attack.

// The frames and payloads: MalformedBehaviours.cpp.
void sendGarbage(Attack& attack);
void sendRandomFrames(Attack& attack);
void sendMutatedFrames(Attack& attack);
void sendHalfFrames(Attack& attack);
void writeOneByteAtATime(Attack& attack);
void sendEmptyFrames(Attack& attack);
void claimHugeFrames(Attack& attack);
void sendTrailingBytes(Attack& attack);
void interleaveFrames(Attack& attack);
void resetAtEveryByte(Attack& attack);
void nestDeeply(Attack& attack);
void sendPayloadBombs(Attack& attack);
void repeatKeys(Attack& attack);
void collideKeys(Attack& attack);
void sendOddText(Attack& attack);
void sendLongKeys(Attack& attack);
void sendWrongArguments(Attack& attack);
void sendWrongOperations(Attack& attack);
void reuseRequestNumbers(Attack& attack);

// Connections: ConnectionBehaviours.cpp.
void passDescriptors(Attack& attack);
void neverRead(Attack& attack);
void readSlowly(Attack& attack);
void shutDownHalf(Attack& attack);
void openAndDrop(Attack& attack);
void holdAllConnections(Attack& attack);
void hoardHalfFrames(Attack& attack);
void dribble(Attack& attack);
void forkWithTheSocket(Attack& attack);
void takeOddProcessNames(Attack& attack);
void killTheService(Attack& attack);
void stayWhileItEnds(Attack& attack);

// Operations: FloodBehaviours.cpp.
void floodWithSessions(Attack& attack);
void floodWithQuestions(Attack& attack);
void repeatIDs(Attack& attack);
void sendToEveryone(Attack& attack);
void floodWithConfigurations(Attack& attack);
void startAndStop(Attack& attack);
void changeTypes(Attack& attack);
void delayAlarms(Attack& attack);
void sendLargeMessages(Attack& attack);
void leaveWhileStarting(Attack& attack);
void squatIDs(Attack& attack);
void chooseIDs(Attack& attack);
void mixOperations(Attack& attack);
void forgeLogLines(Attack& attack);
void plantInTheLogDirectory(Attack& attack);

}  // namespace ostrel::hostile
