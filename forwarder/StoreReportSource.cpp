#include "forwarder/StoreReportSource.h"

#include <sys/stat.h>

#include <cerrno>
#include <memory>
#include <utility>

#include "ostrelctl/StoreReader.h"
#include "platform/TelemetryBackend.h"
#include "platform/linux/store/StoreIdentity.h"

namespace ostrel {
namespace {

std::int64_t integerOf(const JSONNode& column) {
  return column.signedInteger().value_or(0);
}

const JSONNode* memberOf(const JSONNode& node, std::string_view key) {
  return node.object() != nullptr ? find(*node.object(), key) : nullptr;
}

/// The first of them always, and as many more as there is room for.
std::string statement(std::int64_t id, BatchSize most) {
  return "WITH next AS (SELECT m.*, s.reporter_id, s.hierarchy_token,"
         " coalesce(m.user_info, s.user_info) AS user"
         " FROM telemetry_messages AS m LEFT JOIN telemetry_sessions AS s"
         " ON s.id = m.telemetry_session_id WHERE m.id > " +
         std::to_string(id) + " ORDER BY m.id LIMIT " + std::to_string(most.reports) +
         "), sized AS (SELECT *, coalesce(length(payload), 0) + coalesce(length(user), 0)"
         " AS size FROM next)"
         " SELECT id, telemetry_session_id, reporter_id, hierarchy_token, session_info,"
         " user, category, type, payload, created_at, sum(size) OVER (ORDER BY id) - size"
         " AS before FROM sized";
}

Report reportOf(StoreReader::Row& row) {
  Report report;
  report.id = integerOf(row[0]);
  report.sessionID = row[1].signedInteger();
  report.reporterID = row[2].signedInteger();
  report.hierarchyToken = textColumn(row[3]);
  // A message without a session says itself what belongs to one.
  const JSONNode info = jsonColumn(std::move(row[4]));
  if (const JSONNode* reporter = memberOf(info, kTelvarSessionInfoSessionID)) {
    report.reporterID = reporter->signedInteger();
  }
  if (const JSONNode* token = memberOf(info, kTelvarSessionInfoHierarchyToken)) {
    report.hierarchyToken = textColumn(*token);
  }
  report.userInfo = jsonColumn(std::move(row[5]));
  report.category = integerOf(row[6]);
  report.type = integerOf(row[7]);
  report.payload = jsonColumn(std::move(row[8]));
  report.createdAt = integerOf(row[9]);
  return report;
}

}  // namespace

Outcome<ReportBatch> StoreReportSource::reportsAfter(std::int64_t id, BatchSize most) {
  struct stat status {};
  if (::stat(path_.c_str(), &status) != 0 && errno == ENOENT) return {ReportBatch{}, {}};
  auto opened = StoreReader::open(path_);
  if (!opened.value) return {{}, std::move(opened.error)};
  StoreReader& reader = **opened.value;

  ReportBatch batch;
  Success success =
      reader.query(std::string("SELECT value FROM service_status WHERE key = '") +
                       kStoreIdentityKey + "'",
                   [&](const auto&, const StoreReader::Row& row) {
                     batch.store = textColumn(row[0]);
                   });
  // One that has no name yet gets it with its next commit.
  if (success.succeeded && batch.store.empty()) return {std::move(batch), {}};
  if (success.succeeded) {
    success = reader.query("SELECT max(id) FROM telemetry_messages",
                           [&](const auto&, const StoreReader::Row& row) {
                             batch.newestID = integerOf(row[0]);
                           });
  }
  if (success.succeeded) {
    const std::string where = "SELECT * FROM (" + statement(id, most) +
                              ") WHERE before < " + std::to_string(most.bytes) +
                              " ORDER BY id";
    success = reader.query(where, [&](const auto&, StoreReader::Row row) {
      batch.reports.push_back(reportOf(row));
    });
  }
  if (!success.succeeded) return {{}, std::move(success.error)};
  return {std::move(batch), {}};
}

}  // namespace ostrel
