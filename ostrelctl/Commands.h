// The commands of the tool. Each returns the exit status.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

#include "ostrelctl/Tool.h"

namespace ostrel {

/// The script in the file, or from the tool's input when that is "-".
int runScript(const Tool& tool, const std::string& file);

int runStatus(const Tool& tool, bool json);

struct SendOptions {
  std::string category;
  std::string type;
  std::vector<std::int64_t> reporterIDs;  // Empty: no list.
  std::optional<std::string> payload;     // JSON.
  std::vector<std::string> entries;       // KEY=VALUE.
  double timeoutSeconds = 5;
  bool json = false;
};
int runSend(const Tool& tool, const SendOptions& options);

int runSessions(const Tool& tool, std::int64_t limit, bool json);

/// `session` is the id of a recorded session, the ID of a reporter (its newest
/// session is meant then), or "last".
int runShow(const Tool& tool, const std::string& session, bool json);

struct TailOptions {
  std::int64_t earlier = 0;            // Messages to begin with.
  std::optional<std::uint64_t> count;  // Messages after which to end.
  bool json = false;
};
int runTail(const Tool& tool, const TailOptions& options);

int runQuery(const Tool& tool, const std::string& sql, bool json);

/// No key prints all of the suite.
int runDefaultsRead(const Tool& tool, const std::optional<std::string>& key, bool json);
int runDefaultsWrite(const Tool& tool, const std::string& key, const std::string& value);
int runDefaultsDelete(const Tool& tool, const std::string& key);

int runNotify(const Tool& tool);

}  // namespace ostrel
