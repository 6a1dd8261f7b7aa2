#include "ostrelctl/ScriptPlayer.h"

#include <gtest/gtest.h>
#include <sys/socket.h>
#include <unistd.h>

#include <ext/stdio_filebuf.h>
#include <future>
#include <sstream>
#include <thread>

#include "ostrelctl/FakeServiceConnection.h"
#include "ostrelctl/ManualToolClock.h"

namespace ostrel {
namespace {

using namespace std::chrono_literals;

class ScriptPlayerTest : public ::testing::Test {
 protected:
  int play(const std::string& script) {
    std::istringstream in(script);
    return play(in);
  }
  int play(std::istream& in) {
    ScriptPlayer player([this] { return connect(); }, clock_, out_, err_);
    return player.play(in);
  }
  Outcome<std::shared_ptr<ServiceConnection>> connect() {
    if (connectionsAllowed_ == 0) {
      return {{}, ErrorObject{"test", 1, "no service at /run/test.sock"}};
    }
    --connectionsAllowed_;
    connections_.push_back(std::make_shared<FakeServiceConnection>());
    connections_.back()->onRequest = [this] { onRequest_(); };
    return {connections_.back(), {}};
  }
  FakeServiceConnection& connection(std::size_t index) { return *connections_.at(index); }

  ManualToolClock clock_;
  std::ostringstream out_;
  std::ostringstream err_;
  std::vector<std::shared_ptr<FakeServiceConnection>> connections_;
  int connectionsAllowed_ = 100;
  std::function<void()> onRequest_ = [] {};
};

TEST_F(ScriptPlayerTest, SendsEveryOperationWithItsArguments) {
  EXPECT_EQ(play(R"({"op":"createReportingSession","reporterID":-9223372036854775808}
{"op":"setServiceType","serviceType":7,"reporterID":1}
{"op":"getServiceNameForReporterID","reporterID":0}
{"op":"setConfiguration","configuration":{"a":"b"},"reporterID":9223372036854775807}
{"op":"setConfiguration","configuration":null,"reporterID":1}
{"op":"startReportingSessionForID","reporterID":1}
{"op":"sendMessage","message":{"k":1},"category":"0x40000007","type":65535}
{"op":"sendMessage","message":{},"category":4294967295,"type":"1","reporterIDs":[1,-2]}
{"op":"sendMessage","message":{},"category":0,"type":0,"reporterIDs":[]}
{"op":"stopReportingSessionForID","reporterID":1}
{"op":"destroyReportingSession","reporterID":1}
{"op":"reporterIDValid","reporterID":1}
{"op":"getAllReporters"}
{"op":"killService"}
)"),
            0);
  EXPECT_EQ(connection(0).calls,
            (std::vector<std::string>{
                "createReportingSession -9223372036854775808", "setServiceType 7 1",
                "getServiceNameForReporterID 0",
                "setConfiguration {a: b} 9223372036854775807", "setConfiguration none 1",
                "startReportingSessionForID 1", "sendMessage {k: 1} 1073741831 65535",
                "sendMessage {} 4294967295 1 [1,-2,]", "sendMessage {} 0 0 []",
                "stopReportingSessionForID 1", "destroyReportingSession 1",
                "reporterIDValid 1", "getAllReporters", "killService", "close"}));
}

TEST_F(ScriptPlayerTest, PrintsTheReplyOfEachKind) {
  clock_.meanwhile = [this] {
    connection(0).boolReplies.at(0)(true);
    connection(0).serviceTypeReplies.at(0)(ServiceType{65535});
    connection(0).dictionaryReplies.at(0)(
        Dictionary{{"reporterID", Value(5)}, {"serviceType", Value(7)}});
    connection(0).reporterIDsReplies.at(0)({ReporterID{3}, ReporterID{-4}});
    connection(0).errorReplies.at(0)(std::nullopt);
    connection(0).errorReplies.at(1)(ErrorObject{"d\"", -3, "wrong"});
  };
  EXPECT_EQ(play(R"({"op":"createReportingSession","reporterID":5}
{"op":"getServiceNameForReporterID","reporterID":6}
{"op":"reporterIDValid","reporterID":5}
{"op":"getAllReporters"}
{"op":"sendMessage","message":{},"category":1,"type":0}
{"op":"sendMessage","message":{},"category":1,"type":0}
{"wait":5}
)"),
            0);
  EXPECT_EQ(out_.str(),
            R"({"line":1,"client":"default","op":"createReportingSession","reply":true}
{"line":2,"client":"default","op":"getServiceNameForReporterID","reply":65535}
{"line":3,"client":"default","op":"reporterIDValid","reply":{"reporterID":5,"serviceType":7}}
{"line":4,"client":"default","op":"getAllReporters","reply":[3,-4]}
{"line":5,"client":"default","op":"sendMessage","reply":null}
{"line":6,"client":"default","op":"sendMessage","error":{"domain":"d\"","code":-3,"description":"wrong"}}
)");
  EXPECT_TRUE(clock_.fullWaits.empty());
}

TEST_F(ScriptPlayerTest, PrintsASecondReplyAsASecondLine) {
  clock_.meanwhile = [this] {
    connection(0).serviceTypeReplies.at(0)(ServiceType{65535});
    connection(0).serviceTypeReplies.at(0)(ServiceType{65535});
  };
  play("{\"op\":\"getServiceNameForReporterID\",\"reporterID\":0}\n{\"wait\":1}\n");
  const std::string line =
      R"({"line":1,"client":"default","op":"getServiceNameForReporterID","reply":65535})"
      "\n";
  EXPECT_EQ(out_.str(), line + line);
}

TEST_F(ScriptPlayerTest, CountsBlankLines) {
  EXPECT_EQ(play("\n  \t\r\n{\"op\":\"killService\"}"), 0);
  EXPECT_EQ(
      out_.str(),
      "{\"line\":3,\"client\":\"default\",\"op\":\"killService\",\"noReply\":true}\n");
}

TEST_F(ScriptPlayerTest, PrintsWhatGotNoReplyLastInTheOrderOfTheLines) {
  clock_.meanwhile = [this] { connection(0).boolReplies.at(0)(true); };
  EXPECT_EQ(play(R"({"op":"stopReportingSessionForID","reporterID":1,"client":"z"}
{"op":"stopReportingSessionForID","reporterID":0,"client":"a"}
{"op":"stopReportingSessionForID","reporterID":0,"client":"z"}
{"close":"a"}
{"sleep":0.5}
)"),
            0);
  EXPECT_EQ(out_.str(),
            R"({"line":1,"client":"z","op":"stopReportingSessionForID","reply":true}
{"line":2,"client":"a","op":"stopReportingSessionForID","noReply":true}
{"line":3,"client":"z","op":"stopReportingSessionForID","noReply":true}
)");
}

TEST_F(ScriptPlayerTest, OpensOneConnectionForEachName) {
  play(R"({"op":"getAllReporters","client":"a"}
{"op":"getAllReporters"}
{"op":"getAllReporters","client":"a"}
{"op":"getAllReporters","client":"default"}
)");
  ASSERT_EQ(connections_.size(), 2U);
  EXPECT_EQ(connection(0).calls,
            (std::vector<std::string>{"getAllReporters", "getAllReporters", "close"}));
  EXPECT_EQ(connection(1).calls,
            (std::vector<std::string>{"getAllReporters", "getAllReporters", "close"}));
}

TEST_F(ScriptPlayerTest, EndsConnectionsAsTheScriptSaysAndPrintsNothing) {
  play(R"({"op":"getAllReporters","client":"a"}
{"op":"getAllReporters","client":"b"}
{"wait":1}
{"close":"a"}
{"abort":"b"}
{"close":"never opened"}
)");
  EXPECT_EQ(connection(0).calls, (std::vector<std::string>{"getAllReporters", "close"}));
  EXPECT_EQ(connection(1).calls, (std::vector<std::string>{"getAllReporters", "abort"}));
  EXPECT_EQ(out_.str(),
            R"({"line":1,"client":"a","op":"getAllReporters","noReply":true}
{"line":2,"client":"b","op":"getAllReporters","noReply":true}
)");
}

TEST_F(ScriptPlayerTest, OpensAConnectionAnewAfterItWasClosed) {
  play(R"({"op":"getAllReporters","client":"a"}
{"abort":"a"}
{"op":"getAllReporters","client":"a"}
)");
  ASSERT_EQ(connections_.size(), 2U);
  EXPECT_EQ(connection(0).calls, (std::vector<std::string>{"getAllReporters", "abort"}));
  EXPECT_EQ(connection(1).calls, (std::vector<std::string>{"getAllReporters", "close"}));
}

TEST_F(ScriptPlayerTest, PrintsAConnectionThatTheServiceClosed) {
  clock_.meanwhile = [this] { connection(0).closedHandler("it went away"); };
  EXPECT_EQ(play("{\"op\":\"killService\",\"client\":\"k\"}\n{\"wait\":5}\n"), 0);
  EXPECT_EQ(out_.str(),
            R"({"client":"k","closed":"it went away"}
{"line":1,"client":"k","op":"killService","noReply":true}
)");
  EXPECT_TRUE(clock_.fullWaits.empty());
}

TEST_F(ScriptPlayerTest, OpensAConnectionAnewAfterTheServiceClosedIt) {
  clock_.meanwhile = [this] { connection(0).closedHandler("cut off"); };
  play(R"({"op":"killService"}
{"sleep":1}
{"op":"getAllReporters"}
)");
  ASSERT_EQ(connections_.size(), 2U);
  EXPECT_EQ(connection(1).calls, (std::vector<std::string>{"getAllReporters", "close"}));
}

TEST_F(ScriptPlayerTest, WaitsItsFullTimeForARequestThatNothingAnswers) {
  play("{\"op\":\"stopReportingSessionForID\",\"reporterID\":0}\n{\"wait\":2.5}\n");
  EXPECT_EQ(clock_.fullWaits, (std::vector<std::chrono::nanoseconds>{2500ms}));
}

TEST_F(ScriptPlayerTest, DoesNotWaitForRequestsOfEndedConnections) {
  play(R"({"op":"killService","client":"a"}
{"close":"a"}
{"op":"killService","client":"b"}
{"abort":"b"}
{"wait":3}
)");
  EXPECT_TRUE(clock_.fullWaits.empty());
}

TEST_F(ScriptPlayerTest, WaitsForRequestsOfEveryConnection) {
  clock_.meanwhile = [this] { connection(0).boolReplies.at(0)(true); };
  play(R"({"op":"createReportingSession","reporterID":1,"client":"a"}
{"op":"createReportingSession","reporterID":1,"client":"b"}
{"wait":3}
)");
  EXPECT_EQ(clock_.fullWaits, (std::vector<std::chrono::nanoseconds>{3s}));
}

TEST_F(ScriptPlayerTest, CountsARequestAsAnsweredAfterItsFirstReply) {
  onRequest_ = [this] { connection(0).serviceTypeReplies.back()(ServiceType{1}); };
  play("{\"op\":\"getServiceNameForReporterID\",\"reporterID\":0}\n{\"wait\":3}\n");
  EXPECT_TRUE(clock_.fullWaits.empty());
}

TEST_F(ScriptPlayerTest, SleepsForTheTimeGiven) {
  play("{\"sleep\":0.25}\n{\"sleep\":2}\n{\"sleep\":0}\n");
  EXPECT_EQ(clock_.sleeps, (std::vector<std::chrono::nanoseconds>{250ms, 2s, 0s}));
}

TEST_F(ScriptPlayerTest, AnEmptyScriptNeedsNoService) {
  connectionsAllowed_ = 0;
  EXPECT_EQ(play(""), 0);
  EXPECT_EQ(out_.str(), "");
}

TEST_F(ScriptPlayerTest, FailsWithASentenceWithoutAService) {
  connectionsAllowed_ = 0;
  EXPECT_EQ(play("{\"op\":\"getAllReporters\"}\n{\"op\":\"getAllReporters\"}\n"), 1);
  EXPECT_EQ(out_.str(), "");
  EXPECT_EQ(err_.str(), "ostrelctl: line 1: no service at /run/test.sock\n");
}

TEST_F(ScriptPlayerTest, EndsAllConnectionsWellWhenALineIsWrong) {
  EXPECT_EQ(play("{\"op\":\"getAllReporters\"}\n\n{\"op\":\"dance\"}\n"
                 "{\"op\":\"killService\"}\n"),
            2);
  EXPECT_EQ(err_.str(), "ostrelctl: line 3: there is no operation \"dance\"\n");
  EXPECT_EQ(connection(0).calls, (std::vector<std::string>{"getAllReporters", "close"}));
  EXPECT_EQ(out_.str(), "");
}

TEST_F(ScriptPlayerTest, SaysWhichMembersItIgnores) {
  EXPECT_EQ(play("{\"op\":\"getAllReporters\",\"reporterId\":5}"), 0);
  EXPECT_EQ(err_.str(), "ostrelctl: line 1: \"reporterId\" is ignored\n");
}

TEST_F(ScriptPlayerTest, FailsWhenTheRepliesCannotBeWritten) {
  out_.setstate(std::ios::badbit);
  EXPECT_EQ(play("{\"op\":\"killService\"}\n"), 1);
}

TEST_F(ScriptPlayerTest, ActsOnALineBeforeTheNextIsWritten) {
  int ends[2];
  ASSERT_EQ(::pipe(ends), 0);
  __gnu_cxx::stdio_filebuf<char> buffer(ends[0], std::ios::in);
  std::istream in(&buffer);
  std::promise<void> seen;
  std::promise<void> seenAgain;
  int requests = 0;
  onRequest_ = [&] { (++requests == 1 ? seen : seenAgain).set_value(); };

  std::thread player([&] { EXPECT_EQ(play(in), 0); });
  const std::string line = "{\"op\":\"getAllReporters\"}\n";
  ASSERT_EQ(::write(ends[1], line.data(), line.size()),
            static_cast<ssize_t>(line.size()));
  seen.get_future().wait();
  ASSERT_EQ(::write(ends[1], line.data(), line.size()),
            static_cast<ssize_t>(line.size()));
  seenAgain.get_future().wait();
  ::close(ends[1]);
  player.join();
}

TEST_F(ScriptPlayerTest, PrintsRepliesFromAnotherThreadWhileItSleeps) {
  std::thread service;
  clock_.meanwhile = [&] {
    service = std::thread([this] { connection(0).boolReplies.at(0)(true); });
    service.join();
    EXPECT_NE(out_.str().find("\"reply\":true"), std::string::npos);
  };
  EXPECT_EQ(play("{\"op\":\"createReportingSession\",\"reporterID\":1}\n{\"sleep\":1}\n"),
            0);
}

TEST_F(ScriptPlayerTest, EndsARealWaitWhenTheReplyCameFromAnotherThread) {
  std::thread service;
  onRequest_ = [&] {
    service = std::thread([this] { connection(0).boolReplies.at(0)(true); });
  };
  ScriptPlayer player([this] { return connect(); }, realToolClock(), out_, err_);
  std::istringstream in(
      "{\"op\":\"createReportingSession\",\"reporterID\":1}\n{\"wait\":60}\n");
  const auto before = std::chrono::steady_clock::now();
  EXPECT_EQ(player.play(in), 0);
  EXPECT_LT(std::chrono::steady_clock::now() - before, 30s);
  service.join();
}

}  // namespace
}  // namespace ostrel
