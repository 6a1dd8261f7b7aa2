#include "tests/hostile/Behaviours.h"

namespace ostrel::hostile {
namespace {

constexpr Behaviour kBehaviours[] = {
    {"garbage", "sends random bytes", sendGarbage},
    {"random-frames", "sends frames of random bytes", sendRandomFrames},
    {"mutated-frames", "sends requests in which bytes were changed", sendMutatedFrames},
    {"half-frames", "sends the beginning of a request and leaves", sendHalfFrames},
    {"one-byte-a-write", "writes requests byte by byte", writeOneByteAtATime},
    {"empty-frames", "sends frames of no bytes", sendEmptyFrames},
    {"huge-frames", "says lengths from the limit to 2^32-1", claimHugeFrames},
    {"trailing-bytes", "lets more follow in a frame than its item", sendTrailingBytes},
    {"interleaved-frames", "puts one frame into the middle of another", interleaveFrames},
    {"reset-at-every-byte", "leaves a dialogue at each of its bytes", resetAtEveryByte},
    {"nesting", "nests payloads up to the limit and beyond", nestDeeply},
    {"payload-bombs", "sends as many empty values as a frame holds", sendPayloadBombs},
    {"repeated-keys", "fills dictionaries with one key", repeatKeys},
    {"colliding-keys", "sends keys that become one when blanks are replaced",
     collideKeys},
    {"odd-text", "sends text that is not UTF-8, and NUL, blanks and nothing",
     sendOddText},
    {"long-keys", "sends keys around the limit of their length", sendLongKeys},
    {"wrong-arguments", "gets each argument of each operation wrong", sendWrongArguments},
    {"wrong-operations", "calls operations that are none, with too much and too little",
     sendWrongOperations},
    {"reused-numbers", "gives all its requests one number", reuseRequestNumbers},
    {"descriptors", "passes descriptors along with its requests", passDescriptors},
    {"never-reads", "asks without reading the answers", neverRead},
    {"slow-reader", "reads its answers one byte at a time", readSlowly},
    {"half-shut", "shuts down one direction of its connections", shutDownHalf},
    {"opens-and-drops", "opens and drops 20,000 connections", openAndDrop},
    {"all-connections", "holds all the connections that it gets", holdAllConnections},
    {"hoarded-frames", "begins the largest frame on many connections", hoardHalfFrames},
    {"dribble", "sends a byte now and then on many connections", dribble},
    {"forked-socket", "shares a connection with its children, who exec",
     forkWithTheSocket},
    {"odd-process-names", "connects from processes with names that forge lines",
     takeOddProcessNames},
    {"session-flood", "creates sessions without end", floodWithSessions},
    {"question-flood", "asks for everybody's sessions without end", floodWithQuestions},
    {"repeated-ids", "sends to one session 1,024 times at once", repeatIDs},
    {"everyone", "starts many sessions and sends to all of them", sendToEveryone},
    {"configuration-flood", "sets ever new keys", floodWithConfigurations},
    {"start-stop-storm", "starts and stops sessions as fast as it can", startAndStop},
    {"type-storm", "changes the type of a started session all the time", changeTypes},
    {"alarms", "sends messages that are held back for up to a minute", delayAlarms},
    {"large-messages", "keeps sending the largest messages to a session",
     sendLargeMessages},
    {"leaves-while-starting", "starts sessions and is gone before they are",
     leaveWhileStarting},
    {"squatted-ids", "takes others' IDs, and stops and changes their sessions", squatIDs},
    {"chosen-ids", "chooses IDs and keys that meet in tables", chooseIDs},
    {"mixed-operations", "calls the operations at random", mixOperations},
    {"forged-log-lines", "sends text that looks like the log's", forgeLogLines},
    {"planted-logs", "plants links and pipes where session logs are written",
     plantInTheLogDirectory},
    {"kill", "tells the service to end", killTheService, /*endsTheService=*/true},
    {"stays", "leaves everything half done and waits for the service to end",
     stayWhileItEnds, /*endsTheService=*/true},
};

}  // namespace

std::span<const Behaviour> behaviours() { return kBehaviours; }

}  // namespace ostrel::hostile
