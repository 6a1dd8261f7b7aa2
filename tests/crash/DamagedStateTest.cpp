// The service starts by itself on whatever it finds in its places: it serves its clients
// within 2 s, says in its log what is wrong, and loses nothing that could be read.
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <functional>
#include <random>

#include "tests/crash/LoadedService.h"

namespace ostrel::crash {
namespace {

namespace fs = std::filesystem;
using namespace std::chrono_literals;

constexpr int kMessages = 20;
constexpr ReporterID kReporter{7};

// What the state does to the reports of before.
enum class Before {
  kKept,       // They are in the store.
  kKeptAlone,  // So they are; what stood beside it is set aside.
  kSetAside,   // What stood in the store's place is beside it, as it was.
  kUntouched,  // It stands in its place, as it was; the service does without.
  kNone,       // There is nothing left to keep.
};
// Whether new reports are stored.
enum class After { kStored, kRefused };

struct State {
  const char* name;
  Before before;
  After after;
  const char* inLog;  // Empty: nothing to complain of.
  std::function<void(const ServiceUnderTest&)> damage;
};

std::ostream& operator<<(std::ostream& out, const State& state) {
  return out << state.name;
}

constexpr const char* kStore = "state/reports.db";
constexpr const char* kDefaults = "state/defaults/com.orbisk.ostrel.json";

std::string noise(std::size_t size) {
  std::mt19937 random(20260131);
  std::string bytes(size, '\0');
  for (char& byte : bytes) byte = static_cast<char>(random());
  return bytes;
}

void overwrite(const ServiceUnderTest& service, const char* name, std::size_t offset,
               const std::string& bytes) {
  std::fstream file(service / name, std::ios::in | std::ios::out | std::ios::binary);
  file.seekp(static_cast<std::streamoff>(offset));
  file << bytes;
  ASSERT_TRUE(file.good());
}

// Something else in place of what stood there.
void replace(const ServiceUnderTest& service, const char* name,
             const std::string& content) {
  fs::create_directories(fs::path(service / name).parent_path());
  fs::remove_all(service / name);
  service.write(name, content);
}

void replaceByLink(const ServiceUnderTest& service, const char* name,
                   const std::string& target) {
  replace(service, name, "");
  fs::remove(service / name);
  fs::create_symlink(target, service / name);
}

void replaceByPipe(const ServiceUnderTest& service, const char* name) {
  replace(service, name, "");
  fs::remove(service / name);
  ASSERT_EQ(::mkfifo((service / name).c_str(), 0600), 0);
}

void replaceByDirectory(const ServiceUnderTest& service, const char* name) {
  replace(service, name, "");
  fs::remove(service / name);
  fs::create_directories(service / name + "/inside");
}

void alter(const ServiceUnderTest& service, const char* sql) {
  OtherConnection(service / kStore).run(sql);
}

// Of another user, where the test may give files away.
void giveAway(const std::string& path) {
  fs::permissions(path, fs::perms::owner_read | fs::perms::owner_write);
  if (::chown(path.c_str(), 65534, 65534) != 0) fs::permissions(path, fs::perms::none);
}

// The log of a store that went another way: its pages do not go with ours.
void takeLogOfAnotherStore(const ServiceUnderTest& service) {
  const std::string other = service / "other.db";
  fs::copy_file(service / kStore, other);
  OtherConnection connection(other);
  connection.run(
      "WITH RECURSIVE n(i) AS (SELECT 1 UNION ALL SELECT i + 1 FROM n WHERE i < 5000) "
      "INSERT INTO telemetry_messages (payload) SELECT hex(zeroblob(300)) FROM n; "
      "PRAGMA wal_checkpoint(TRUNCATE); DELETE FROM telemetry_messages WHERE id > 4000");
  fs::copy_file(other + "-wal", service / "state/reports.db-wal");
}

const State kStates[] = {
    // The store.
    {"NoStateDirectory", Before::kNone, After::kStored, "",
     [](const auto& service) { fs::remove_all(service / "state"); }},
    {"StoreOfNoBytes", Before::kNone, After::kStored, "",
     [](const auto& service) { replace(service, kStore, ""); }},
    {"StoreOfOneByte", Before::kSetAside, After::kStored, "it is not a database",
     [](const auto& service) { replace(service, kStore, "S"); }},
    {"StoreOfText", Before::kSetAside, After::kStored, "it is not a database",
     [](const auto& service) { replace(service, kStore, std::string(5000, 't')); }},
    {"StoreOfNoise", Before::kSetAside, After::kStored, "it is not a database",
     [](const auto& service) { replace(service, kStore, noise(100'000)); }},
    {"StoreCutInTwo", Before::kSetAside, After::kStored, "malformed",
     [](const auto& service) {
       fs::resize_file(service / kStore, fs::file_size(service / kStore) / 2 + 100);
     }},
    {"StoreCutInItsHeader", Before::kSetAside, After::kStored, "aside",
     [](const auto& service) { fs::resize_file(service / kStore, 50); }},
    {"StoreWithoutItsFirstPage", Before::kSetAside, After::kStored,
     "it is not a database",
     [](const auto& service) {
       overwrite(service, kStore, 0, std::string(16384, '\0'));
     }},
    {"StoreWithAPageOfZeros", Before::kSetAside, After::kStored, "aside",
     [](const auto& service) {
       overwrite(service, kStore, 2 * 16384, std::string(16384, '\0'));
     }},
    {"StoreWithAPageOfNoise", Before::kSetAside, After::kStored, "aside",
     [](const auto& service) { overwrite(service, kStore, 16384, noise(16384)); }},
    {"StoreWithOtherTables", Before::kSetAside, After::kStored, "its tables are others",
     [](const auto& service) {
       alter(service, "ALTER TABLE telemetry_messages DROP COLUMN payload");
     }},
    {"StoreOfSomethingElse", Before::kSetAside, After::kStored, "it holds something else",
     [](const auto& service) {
       fs::remove(service / kStore);
       alter(service, "CREATE TABLE songs (title TEXT)");
     }},
    {"StoreOfALaterVersion", Before::kUntouched, After::kRefused,
     "the store has version 3, written by a later service",
     [](const auto& service) { alter(service, "PRAGMA user_version = 3"); }},
    {"LogOfNoise", Before::kKept, After::kStored, "",
     [](const auto& service) {
       replace(service, "state/reports.db-wal", noise(100'000));
       replace(service, "state/reports.db-shm", noise(32'768));
     }},
    {"LogOfAnotherStore", Before::kSetAside, After::kStored, "aside",
     takeLogOfAnotherStore},
    {"DirectoryAsLog", Before::kKeptAlone, After::kStored, "reports.db-wal",
     [](const auto& service) { replaceByDirectory(service, "state/reports.db-wal"); }},
    {"DirectoryAsIndex", Before::kKeptAlone, After::kStored, "reports.db-shm",
     [](const auto& service) { replaceByDirectory(service, "state/reports.db-shm"); }},
    {"PipeAsIndex", Before::kKeptAlone, After::kStored, "reports.db-shm",
     [](const auto& service) { replaceByPipe(service, "state/reports.db-shm"); }},
    {"LinkAsLog", Before::kKeptAlone, After::kStored, "reports.db-wal",
     [](const auto& service) {
       replaceByLink(service, "state/reports.db-wal", "/nonexistent/wal");
     }},
    {"DirectoryAsStore", Before::kSetAside, After::kStored, "it is not a regular file",
     [](const auto& service) { replaceByDirectory(service, kStore); }},
    {"PipeAsStore", Before::kSetAside, After::kStored, "it is not a regular file",
     [](const auto& service) { replaceByPipe(service, kStore); }},
    {"LinkToNothingAsStore", Before::kSetAside, After::kStored,
     "it is not a regular file",
     [](const auto& service) { replaceByLink(service, kStore, "/nonexistent/db"); }},
    {"StoreOfAnotherUser", Before::kSetAside, After::kStored, "it belongs to user",
     [](const auto& service) { giveAway(service / kStore); }},
    {"StateDirectoryReadOnly", Before::kUntouched, After::kRefused, "cannot be used",
     [](const auto& service) {
       fs::permissions(service / "state", fs::perms::owner_read | fs::perms::owner_exec);
     }},
    {"FileAsStateDirectory", Before::kNone, After::kRefused, "Not a directory",
     [](const auto& service) { replace(service, "state", "no directory"); }},
    {"LinkToNothingAsStateDirectory", Before::kNone, After::kRefused,
     "reports.db: No such file or directory",
     [](const auto& service) { replaceByLink(service, "state", "/nonexistent/dir"); }},
    // The directory of the session logs.
    {"FileAsLogDirectory", Before::kKept, After::kStored, "logs: Not a directory",
     [](const auto& service) { replace(service, "logs", "no directory"); }},
    {"FileInTheLogDirectory", Before::kKept, After::kStored, "Reporting: Not a directory",
     [](const auto& service) { replace(service, "logs/Audio", "no directory"); }},
    {"LinkToNothingAsLogDirectory", Before::kKept, After::kStored,
     "logs: No such file or directory",
     [](const auto& service) { replaceByLink(service, "logs", "/nonexistent/dir"); }},
    {"LinkInTheLogDirectory", Before::kKept, After::kStored, "Reporting: Not a directory",
     [](const auto& service) { replaceByLink(service, "logs/Audio", "/tmp"); }},
    {"LogDirectoryReadOnly", Before::kKept, After::kStored,
     "Reporting: Permission denied",
     [](const auto& service) {
       fs::remove_all(service / "logs");
       fs::create_directories(service / "logs");
       fs::permissions(service / "logs", fs::perms::owner_read | fs::perms::owner_exec);
     }},
    // The runtime directory.
    {"FileAsSocket", Before::kKept, After::kStored, "",
     [](const auto& service) { replace(service, "run/reporting.sock", "no socket"); }},
    {"FileAsNotifications", Before::kKept, After::kStored, "",
     [](const auto& service) { replace(service, "run/notify", "no directory"); }},
};

// The defaults are read when somebody says that they changed.
struct DefaultsState {
  const char* name;
  const char* inLog;
  std::function<void(const ServiceUnderTest&)> damage;
};

std::ostream& operator<<(std::ostream& out, const DefaultsState& state) {
  return out << state.name;
}

const DefaultsState kDefaultsStates[] = {
    {"DefaultsOfNoBytes", "cannot read the defaults",
     [](const auto& service) { replace(service, kDefaults, ""); }},
    {"DefaultsOfNoise", "cannot read the defaults",
     [](const auto& service) { replace(service, kDefaults, noise(1000)); }},
    {"DefaultsCutShort", "cannot read the defaults",
     [](const auto& service) { replace(service, kDefaults, R"({"a": tr)"); }},
    {"DefaultsOfAnotherShape", "it is not a JSON object",
     [](const auto& service) { replace(service, kDefaults, "[1, 2]"); }},
    {"DefaultsThatNestDeeply", "it nests too deeply",
     [](const auto& service) {
       replace(service, kDefaults, R"({"a":)" + std::string(50'000, '['));
     }},
    {"DefaultsOfAGibibyte", "File too large",
     [](const auto& service) {
       replace(service, kDefaults, "{");
       fs::resize_file(service / kDefaults, 1024 * 1024 * 1024);
     }},
    {"PipeAsDefaults", "cannot read the defaults",
     [](const auto& service) { replaceByPipe(service, kDefaults); }},
    {"DirectoryAsDefaults", "Is a directory",
     [](const auto& service) { replaceByDirectory(service, kDefaults); }},
    {"LinkAsDefaults", "cannot read the defaults",
     [](const auto& service) { replaceByLink(service, kDefaults, "/etc/hostname"); }},
    {"DefaultsOfAnotherUser", "Permission denied",
     [](const auto& service) {
       replace(service, kDefaults, "{}");
       giveAway(service / kDefaults);
     }},
};

class DamagedPlaces : public ::testing::Test {
 protected:
  static void SetUpTestSuite() {
    sound_ = new ServiceUnderTest;
    makeInternal(*sound_);
    sound_->start();
    sendAndStop(*sound_, /*first=*/1);
    ASSERT_EQ(sound_->terminate(), 0);
  }
  static void TearDownTestSuite() {
    delete sound_;
    sound_ = nullptr;
  }

  void SetUp() override {
    makeInternal(service_);
    fs::copy(*sound_ / "state", service_ / "state", fs::copy_options::recursive);
  }
  void TearDown() override {
    service_.kill();
    for (const char* directory : {"state", "logs"}) {
      std::error_code ignored;
      fs::permissions(service_ / directory, fs::perms::owner_all, ignored);
    }
  }

  // So that sessions have logs.
  static void makeInternal(const ServiceUnderTest& service) {
    service.write("machine-info", "DEPLOYMENT=development\nCHASSIS=handset\n");
  }

  // As a user to whom permissions apply: root would pass over them.
  void start() {
    std::vector<std::string> command{programBeside("ostrelreportingd")};
    if (::geteuid() == 0) {
      command.insert(command.begin(),
                     {"setpriv", "--bounding-set=-dac_override,-dac_read_search"});
    }
    service_.start(command, {});
  }

  // Gives the replies.
  static RecordingClient::Replies sendAndStop(const ServiceUnderTest& service,
                                              int first) {
    RecordingClient client(service.socketPath());
    client->createReportingSession(kReporter, client.boolean("create"));
    client->setServiceType(ServiceType{2}, kReporter, client.boolean("type"));
    client->startReportingSessionForID(kReporter, nullptr);
    for (int i = first; i < first + kMessages; ++i) {
      client->sendMessage({{"i", Value(i)}}, MessageCategory{1}, MessageType{1},
                          ReporterIDs{kReporter}, client.error("send"));
    }
    client->stopReportingSessionForID(kReporter, client.boolean("stop"));
    return client.takeReplies();
  }

  static RecordingClient::Replies allReplies() {
    RecordingClient::Replies replies{"create true", "type true"};
    replies.insert(replies.end(), kMessages, "send no error");
    replies.push_back("stop true");
    return replies;
  }

  std::string storeFile() const { return service_.read(kStore); }

  std::vector<std::string> numbers() const {
    return service_.rows(
        "SELECT json_extract(payload, '$.i') FROM telemetry_messages WHERE category = 1 "
        "AND json_extract(payload, '$.i') NOT NULL ORDER BY id");
  }

  std::vector<fs::path> setAside() const {
    std::vector<fs::path> found;
    for (const auto& entry : fs::directory_iterator(service_ / "state")) {
      const std::string name = entry.path().filename();
      if (name.starts_with("reports.db.damaged-") && !name.ends_with("-wal")) {
        found.push_back(entry.path());
      }
    }
    return found;
  }

  static std::vector<std::string> expectedNumbers(const State& state) {
    std::vector<std::string> numbers;
    const bool isKept =
        state.before == Before::kKept || state.before == Before::kKeptAlone;
    const int first = isKept ? 1 : kMessages + 1;
    const int end = 1 + (state.after == After::kStored ? 2 : 1) * kMessages;
    for (int i = first; i < end; ++i) numbers.push_back(std::to_string(i));
    return numbers;
  }

  static ServiceUnderTest* sound_;
  ServiceUnderTest service_;
};

ServiceUnderTest* DamagedPlaces::sound_ = nullptr;

class DamagedState : public DamagedPlaces, public ::testing::WithParamInterface<State> {};

TEST_P(DamagedState, IsBorne) {
  const State& state = GetParam();
  state.damage(service_);
  const bool wasFile = fs::is_regular_file(fs::symlink_status(service_ / kStore));
  const std::string before = wasFile ? storeFile() : "";

  const auto begin = SteadyClock::now();
  start();
  const auto replies = sendAndStop(service_, kMessages + 1);
  EXPECT_LT(since(begin), 2s * kSlowness);
  EXPECT_EQ(replies, allReplies());
  EXPECT_EQ(service_.terminate(), 0);

  const std::string log = service_.read("log.txt");
  EXPECT_THAT(log, ::testing::HasSubstr(state.inLog));
  if (state.after == After::kStored) {
    EXPECT_EQ(numbers(), expectedNumbers(state)) << log;
  }
  if (state.before == Before::kUntouched) {
    EXPECT_TRUE(before == storeFile());
  }
  if (state.after == After::kRefused) return;
  const bool isOneAside =
      state.before == Before::kSetAside || state.before == Before::kKeptAlone;
  EXPECT_EQ(setAside().size(), isOneAside ? 1u : 0u) << log;
  if (state.before == Before::kSetAside && wasFile && !setAside().empty()) {
    std::ifstream file(setAside().front(), std::ios::binary);
    EXPECT_TRUE(before == std::string(std::istreambuf_iterator<char>(file), {}));
  }
}

INSTANTIATE_TEST_SUITE_P(, DamagedState, ::testing::ValuesIn(kStates),
                         [](const auto& tested) { return tested.param.name; });

class DamagedDefaults : public DamagedPlaces,
                        public ::testing::WithParamInterface<DefaultsState> {};

TEST_P(DamagedDefaults, CountAsNone) {
  const DefaultsState& state = GetParam();
  state.damage(service_);
  start();
  RecordingClient(service_.socketPath()).takeReplies();  // It listens by now.

  ASSERT_EQ(service_.ostrelctl({"notify"}), 0);

  EXPECT_TRUE(eventually([&] {
    return service_.read("log.txt").find(state.inLog) != std::string::npos;
  })) << service_.read("log.txt");
  EXPECT_EQ(sendAndStop(service_, kMessages + 1), allReplies());
  EXPECT_EQ(service_.terminate(), 0);
  EXPECT_EQ(numbers().size(), 2u * kMessages);
}

INSTANTIATE_TEST_SUITE_P(, DamagedDefaults, ::testing::ValuesIn(kDefaultsStates),
                         [](const auto& tested) { return tested.param.name; });

}  // namespace
}  // namespace ostrel::crash
