#include "tests/crash/NumberedClient.h"

#include <gtest/gtest.h>

#include <cstdio>
#include <cstdlib>
#include <optional>

namespace ostrel::crash {
namespace {

using reporting::Category;
using reporting::Client;
using reporting::MessageType;
using reporting::ReporterID;
using reporting::ServiceType;

constexpr Category kCategory{0x10};
constexpr MessageType kType{1};
constexpr ServiceType kServiceType{3};

std::optional<MessageName> nameIn(const std::string& payload) {
  MessageName name;
  long long number = 0;
  if (std::sscanf(payload.c_str(), R"({"c":%d,"n":%lld,)", &name.client, &number) != 2) {
    return std::nullopt;
  }
  name.number = number;
  return name;
}

std::string textIn(sqlite3_stmt* statement, int column) {
  const auto* text =
      reinterpret_cast<const char*>(sqlite3_column_text(statement, column));
  return text != nullptr ? text : "";
}

}  // namespace

std::string textOf(const MessageName& name) {
  const std::uint64_t mixed = (static_cast<std::uint64_t>(name.number) * 64 +
                               static_cast<unsigned>(name.client)) *
                              0x9E3779B97F4A7C15U;
  // Mostly short, some longer than a page of the file.
  const std::size_t size = mixed % 211 == 0 ? 20'000 : mixed % 400;
  const std::string piece = std::to_string(mixed);
  std::string text;
  while (text.size() < size) text += piece;
  text.resize(size);
  return text;
}

std::string payloadOf(const MessageName& name) {
  return R"({"c":)" + std::to_string(name.client) + R"(,"n":)" +
         std::to_string(name.number) + R"(,"text":")" + textOf(name) + R"("})";
}

NumberedClient::NumberedClient(const NumberedClientOptions& options)
    : options_(options), thread_([this] { send(); }) {}

NumberedClient::~NumberedClient() {
  {
    const std::lock_guard lock(mutex_);
    isEnding_ = true;
  }
  changed_.notify_all();
  thread_.join();
}

std::vector<std::pair<MessageName, SteadyClock::time_point>>
NumberedClient::takeAccepted() {
  const std::lock_guard lock(mutex_);
  return std::exchange(accepted_, {});
}

void NumberedClient::send() {
  reporting::Options options;
  options.socketPath = options_.socketPath;
  options.restoreSessions = true;
  options.replyTimeout = std::chrono::milliseconds(0);
  options.closeTimeout = std::chrono::milliseconds(0);
  Client client(options);
  std::mt19937_64 random(options_.seed);
  const ReporterID session{100 + options_.name};
  const auto start = [&] {
    client.createReportingSession(session);
    client.setServiceType(kServiceType, session);
    client.startReportingSessionForID(session);
  };
  start();
  MessageName name{options_.name, 1};
  int untilStop = options_.sessionLength;
  while (!isEnding_) {
    {
      std::unique_lock lock(mutex_);
      changed_.wait(lock, [&] { return underWay_ < options_.window || isEnding_; });
      ++underWay_;
    }
    const auto submitted = client.sendMessage(
        {{"c", name.client}, {"n", name.number}, {"text", textOf(name)}}, kCategory,
        kType, {{session}}, [this, name](const reporting::Reply<void>& reply) {
          end(name, static_cast<bool>(reply));
        });
    if (submitted == reporting::Submission::kQueued) {
      ++name.number;
    } else {
      end(name, /*isAccepted=*/false);
      std::this_thread::sleep_for(std::chrono::milliseconds(1));
    }
    if (options_.pause.count() != 0) std::this_thread::sleep_for(options_.pause);
    if (options_.sessionLength != 0 && --untilStop <= 0) {
      client.destroyReportingSession(session);  // Stops it first.
      start();
      untilStop =
          1 + static_cast<int>(random() % static_cast<unsigned>(options_.sessionLength));
    }
  }
}

void NumberedClient::end(const MessageName& name, bool isAccepted) {
  const std::lock_guard lock(mutex_);
  --underWay_;
  if (isAccepted) {
    accepted_.emplace_back(name, SteadyClock::now());
    ++acceptedCount_;
  }
  changed_.notify_all();
}

bool StoreReader::open() {
  if (connection_ != nullptr) return true;
  const int code = sqlite3_open_v2(path_.c_str(), &connection_, SQLITE_OPEN_READONLY,
                                   /*zVfs=*/nullptr);
  if (code == SQLITE_OK) {
    sqlite3_busy_timeout(connection_, /*ms=*/5000);
    // A store whose maker was killed before it had tables is none yet.
    sqlite3_stmt* statement = nullptr;
    const bool hasTables =
        sqlite3_prepare_v2(connection_, "SELECT 1 FROM telemetry_messages", /*nByte=*/-1,
                           &statement, /*pzTail=*/nullptr) == SQLITE_OK;
    sqlite3_finalize(statement);
    if (hasTables) return true;
  }
  close();
  return false;
}

void StoreReader::close() {
  sqlite3_close(connection_);
  connection_ = nullptr;
}

std::vector<MessageName> StoreReader::look() {
  std::vector<MessageName> found;
  if (!open()) return found;
  sqlite3_stmt* statement = nullptr;
  sqlite3_prepare_v2(connection_,
                     "SELECT id, payload FROM telemetry_messages WHERE id > ? AND "
                     "category = 16 ORDER BY id",
                     /*nByte=*/-1, &statement, /*pzTail=*/nullptr);
  sqlite3_bind_int64(statement, 1, lastRow_);
  while (sqlite3_step(statement) == SQLITE_ROW) {
    lastRow_ = sqlite3_column_int64(statement, 0);
    const std::string payload = textIn(statement, 1);
    const auto name = nameIn(payload);
    EXPECT_TRUE(name) << payload;
    if (!name) continue;
    EXPECT_TRUE(seen_.emplace(*name, lastRow_).second)
        << "twice: " << name->client << ' ' << name->number;
    found.push_back(*name);
  }
  sqlite3_finalize(statement);
  return found;
}

std::string StoreReader::one(const char* sql) {
  sqlite3_stmt* statement = nullptr;
  sqlite3_prepare_v2(connection_, sql, /*nByte=*/-1, &statement, /*pzTail=*/nullptr);
  const int code = sqlite3_step(statement);
  EXPECT_EQ(code, SQLITE_ROW) << sql << ": " << sqlite3_errmsg(connection_);
  std::string text = code == SQLITE_ROW ? textIn(statement, 0) : "";
  sqlite3_finalize(statement);
  return text;
}

void StoreReader::check() {
  ASSERT_TRUE(open() || seen_.empty()) << "the store is gone";
  if (connection_ == nullptr) return;
  EXPECT_EQ(one("PRAGMA quick_check"), "ok");
  const std::string seen =
      "SELECT count(*) FROM telemetry_messages WHERE category = 16 "
      "AND id <= " +
      std::to_string(lastRow_);
  EXPECT_EQ(one(seen.c_str()), std::to_string(seen_.size()));
}

void StoreReader::audit() {
  ASSERT_TRUE(open() || seen_.empty()) << "the store is gone";
  if (connection_ == nullptr) return;
  EXPECT_EQ(one("PRAGMA integrity_check"), "ok");
  sqlite3_stmt* statement = nullptr;
  std::map<MessageName, std::int64_t> present;
  std::map<std::int64_t, std::int64_t> lastNumbers;  // Of each recorded session.
  ASSERT_EQ(
      sqlite3_prepare_v2(connection_,
                         "SELECT m.id, s.id, m.payload FROM telemetry_messages m LEFT "
                         "JOIN telemetry_sessions s ON s.id = m.telemetry_session_id AND "
                         "s.reporter_id = 100 + json_extract(m.payload, '$.c') WHERE "
                         "category = 16 ORDER BY m.id",
                         /*nByte=*/-1, &statement, /*pzTail=*/nullptr),
      SQLITE_OK);
  int code;
  while ((code = sqlite3_step(statement)) == SQLITE_ROW) {
    const std::int64_t row = sqlite3_column_int64(statement, 0);
    const std::int64_t session = sqlite3_column_int64(statement, 1);
    const std::string payload = textIn(statement, 2);
    const MessageName name = nameIn(payload).value_or(MessageName());
    EXPECT_EQ(payload, payloadOf(name));
    EXPECT_NE(session, 0) << "without its session: " << payload;
    EXPECT_TRUE(present.emplace(name, row).second) << "twice: " << payload;
    std::int64_t& last = lastNumbers[session];
    if (last != 0) {
      EXPECT_EQ(name.number, last + 1) << "in session " << session;
    }
    last = name.number;
  }
  EXPECT_EQ(code, SQLITE_DONE) << sqlite3_errmsg(connection_);
  sqlite3_finalize(statement);
  for (const auto& [name, row] : seen_) {
    const auto found = present.find(name);
    ASSERT_TRUE(found != present.end())
        << "lost: message " << name.number << " of client " << name.client;
    ASSERT_EQ(found->second, row);
  }
}

std::int64_t timesFrom(const char* variable, std::int64_t usual) {
  const char* text = std::getenv(variable);
  return text != nullptr ? std::atoll(text) : usual;
}

std::uint64_t seedFrom(std::uint64_t usual) {
  const char* text = std::getenv("OSTREL_SEED");
  return text != nullptr ? std::strtoull(text, /*endptr=*/nullptr, /*base=*/10) : usual;
}

}  // namespace ostrel::crash
