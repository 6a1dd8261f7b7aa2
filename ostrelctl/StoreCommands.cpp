#include <sys/stat.h>

#include <algorithm>
#include <chrono>

#include "ostrelctl/Commands.h"
#include "ostrelctl/Page.h"
#include "ostrelctl/SessionReport.h"
#include "ostrelctl/StoreReader.h"

namespace ostrel {
namespace {

constexpr std::chrono::milliseconds kTailInterval{50};
constexpr std::int64_t kTailBatch = 1000;

std::string compactText(const JSONNode& node) {
  std::string text;
  appendJSON(text, node, JSONSpacing::kCompact);
  return text;
}

int finish(const Tool& tool) {
  tool.out << std::flush;
  return tool.out ? Tool::kDone : tool.fail("the output could not be written");
}

/// The session that a person names.
Outcome<std::vector<RecordedSession>> findSession(StoreReader& store,
                                                  const std::string& name) {
  if (name == "last") return store.newestSession();
  const auto id = parseJSON(name);
  const auto number = id.value ? id.value->signedInteger() : std::nullopt;
  if (!number) return {std::vector<RecordedSession>(), {}};
  auto found = store.session(*number);
  if (found.value && found.value->empty()) return store.newestSessionOfReporter(*number);
  return found;
}

/// Names that appear again get "_2", "_3" and so on.
std::vector<std::string> distinctNames(const std::vector<std::string>& columns) {
  std::vector<std::string> names;
  for (const std::string& column : columns) {
    std::string name = column;
    for (int n = 2; std::find(names.begin(), names.end(), name) != names.end(); ++n) {
      name = column + "_" + std::to_string(n);
    }
    names.push_back(name);
  }
  return names;
}

/// What `query` found, one statement after the other.
struct QueryResult {
  struct Table {
    std::vector<std::string> columns;
    std::vector<Page::Cells> rows;
  };
  std::vector<Table> tables;
  JSONArray objects;

  void add(const std::vector<std::string>& columns, StoreReader::Row row) {
    if (tables.empty() || tables.back().columns != columns)
      tables.push_back({columns, {}});
    const auto names = distinctNames(columns);
    JSONObject object;
    Page::Cells cells;
    for (std::size_t i = 0; i < row.size(); ++i) {
      cells.push_back(row[i].string() != nullptr ? *row[i].string()
                      : row[i].isNull()          ? ""
                                                 : compactText(row[i]));
      object.push_back({names[i], std::move(row[i])});
    }
    tables.back().rows.push_back(std::move(cells));
    objects.push_back({std::move(object)});
  }
};

/// Follows the store, which may come into being, and be replaced, meanwhile.
class Tail {
 public:
  Tail(const Tool& tool, const TailOptions& options) : tool_(tool), options_(options) {}

  int run() {
    openedNumber_ = fileNumber();
    if (openedNumber_) {
      if (const auto error = openAtTheEnd()) return tool_.fail(error->description);
    } else {
      tool_.err << "ostrelctl: waiting for a store at " + tool_.storePath + "\n"
                << std::flush;
    }
    while (!isDone() && tool_.out) {
      followTheFile();
      const auto printed = store_ ? printNew() : Outcome<bool>{false, {}};
      if (!printed.value) return tool_.fail(printed.error->description);
      if (!*printed.value && !isDone()) tool_.clock.sleep(kTailInterval);
    }
    return finish(tool_);
  }

 private:
  std::optional<ErrorObject> openAtTheEnd() {
    auto store = StoreReader::open(tool_.storePath);
    if (!store.value) return store.error;
    auto id = (*store.value)->idBeforeNewest(options_.earlier);
    if (!id.value) return id.error;
    store_ = *store.value;
    lastID_ = *id.value;
    isYoung_ = false;
    return std::nullopt;
  }

  /// Opens the store at its beginning when it came into being or was replaced.
  void followTheFile() {
    const auto number = fileNumber();
    if (!number || (number == openedNumber_ && store_)) return;
    auto store = StoreReader::open(tool_.storePath);
    if (!store.value) return;
    store_ = *store.value;
    openedNumber_ = number;
    lastID_ = 0;
    isYoung_ = true;
  }

  /// Whether there was a message. A store that has no tables yet has none.
  Outcome<bool> printNew() {
    auto messages = store_->messagesAfter(lastID_, kTailBatch);
    if (!messages.value && isYoung_) {
      store_.reset();
      return {false, {}};
    }
    if (!messages.value) return {{}, std::move(messages.error)};
    isYoung_ = false;
    for (const RecordedMessage& message : *messages.value) print(message);
    return {!messages.value->empty(), {}};
  }

  void print(const RecordedMessage& message) {
    lastID_ = message.id;
    if (isDone()) return;
    ++printed_;
    if (options_.json) {
      tool_.out << compactText({messageObject(message)}) + "\n" << std::flush;
      return;
    }
    tool_.out << localTime(message.createdAt) + "  " +
                     (message.reporterID ? std::to_string(*message.reporterID) : "-") +
                     "  " + storedName(message.category, message.type) + "  " +
                     printable(compactText(message.payload)) + "\n"
              << std::flush;
  }

  std::optional<std::uint64_t> fileNumber() const {
    struct stat status {};
    if (::stat(tool_.storePath.c_str(), &status) != 0) return std::nullopt;
    return status.st_ino;
  }
  bool isDone() const { return options_.count && printed_ >= *options_.count; }

  const Tool& tool_;
  const TailOptions options_;
  std::shared_ptr<StoreReader> store_;
  std::optional<std::uint64_t> openedNumber_;
  bool isYoung_ = true;
  std::int64_t lastID_ = 0;
  std::uint64_t printed_ = 0;
};

}  // namespace

int runSessions(const Tool& tool, std::int64_t limit, bool json) {
  auto store = StoreReader::open(tool.storePath);
  if (!store.value) return tool.fail(store.error->description);
  auto sessions = (*store.value)->sessions(limit);
  if (!sessions.value) return tool.fail(sessions.error->description);
  if (json) {
    JSONArray objects;
    for (const auto& session : *sessions.value)
      objects.push_back({sessionObject(session)});
    tool.out << compactText({std::move(objects)}) << '\n';
    return finish(tool);
  }
  std::vector<Page::Cells> rows;
  for (const RecordedSession& session : *sessions.value) {
    rows.push_back(
        {std::to_string(session.id), std::to_string(session.reporterID),
         serviceNameOf(session.userInfo),
         session.startedAt ? localTime(*session.startedAt) : "",
         session.endedAt ? durationText(session.startedAt, session.endedAt) : "running",
         std::to_string(session.messageCount)});
  }
  if (rows.empty()) {
    tool.out << "No session was recorded yet.\n";
  } else {
    Page(tool.out, tool.colours)
        .table({"SESSION", "REPORTER", "SERVICE", "STARTED", "DURATION", "MESSAGES"},
               rows, 0);
  }
  return finish(tool);
}

int runShow(const Tool& tool, const std::string& name, bool json) {
  auto store = StoreReader::open(tool.storePath);
  if (!store.value) return tool.fail(store.error->description);
  auto sessions = findSession(**store.value, name);
  if (!sessions.value) return tool.fail(sessions.error->description);
  if (sessions.value->empty()) return tool.fail("there is no session " + name);
  RecordedSession& session = sessions.value->front();
  auto messages = (*store.value)->messagesOfSession(session.id);
  if (!messages.value) return tool.fail(messages.error->description);
  const SessionReport report(std::move(session), std::move(*messages.value));
  if (json) {
    tool.out << report.json() << '\n';
  } else {
    Page page(tool.out, tool.colours);
    report.writeTo(page);
  }
  return finish(tool);
}

int runTail(const Tool& tool, const TailOptions& options) {
  return Tail(tool, options).run();
}

int runQuery(const Tool& tool, const std::string& sql, bool json) {
  auto store = StoreReader::open(tool.storePath);
  if (!store.value) return tool.fail(store.error->description);
  QueryResult result;
  const Success success =
      (*store.value)
          ->query(sql, [&result](const std::vector<std::string>& columns,
                                 StoreReader::Row row) {
            result.add(columns, std::move(row));
          });
  if (!success.succeeded) return tool.fail(success.error->description);
  if (json) {
    tool.out << compactText({std::move(result.objects)}) << '\n';
  } else {
    Page page(tool.out, tool.colours);
    for (const auto& table : result.tables) page.table(table.columns, table.rows, 0);
  }
  return finish(tool);
}

}  // namespace ostrel
