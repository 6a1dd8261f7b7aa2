#include "ostrelctl/ScriptTranscript.h"

#include <algorithm>

#include "ostrelctl/JSONNode.h"

namespace ostrel {
namespace {

/// The beginning of a request's line, up to its last member.
std::string requestHead(std::uint64_t line, const std::string& client,
                        const std::string& operation) {
  std::string head = "{\"line\":" + std::to_string(line) + ",\"client\":";
  appendQuoted(head, client);
  head += ",\"op\":";
  appendQuoted(head, operation);
  return head + ",";
}

}  // namespace

void ScriptTranscript::connectionOpened(ConnectionNumber connection) {
  const std::lock_guard lock(mutex_);
  open_.emplace(connection, 0);
}

void ScriptTranscript::connectionEnded(ConnectionNumber connection) {
  const std::lock_guard lock(mutex_);
  end(connection);
}

void ScriptTranscript::connectionClosed(ConnectionNumber connection,
                                        const std::string& client,
                                        const std::string& reason) {
  const std::lock_guard lock(mutex_);
  print("{\"client\":" + inQuotes(client) + ",\"closed\":" + inQuotes(reason) + "}");
  end(connection);
}

bool ScriptTranscript::isOpen(ConnectionNumber connection) const {
  const std::lock_guard lock(mutex_);
  return open_.contains(connection);
}

void ScriptTranscript::requestSent(std::uint64_t line, const std::string& client,
                                   const std::string& operation,
                                   ConnectionNumber connection) {
  const std::lock_guard lock(mutex_);
  unanswered_.emplace(line, Unanswered{client, operation, connection});
  if (const auto open = open_.find(connection); open != open_.end()) ++open->second;
}

void ScriptTranscript::requestAnswered(std::uint64_t line, const std::string& client,
                                       const std::string& operation,
                                       const std::string& member) {
  const std::lock_guard lock(mutex_);
  print(requestHead(line, client, operation) + member + "}");
  const auto found = unanswered_.find(line);
  if (found == unanswered_.end()) return;
  const auto open = open_.find(found->second.connection);
  if (open != open_.end()) --open->second;
  unanswered_.erase(found);
  changed_.notify_all();
}

void ScriptTranscript::wait(std::chrono::nanoseconds longest) {
  std::unique_lock lock(mutex_);
  clock_.wait(lock, changed_, longest, [this] {
    return std::all_of(open_.begin(), open_.end(),
                       [](const auto& connection) { return connection.second == 0; });
  });
}

void ScriptTranscript::printUnanswered() {
  const std::lock_guard lock(mutex_);
  for (const auto& [line, request] : unanswered_) {
    print(requestHead(line, request.client, request.operation) + "\"noReply\":true}");
  }
}

void ScriptTranscript::print(const std::string& line) {
  out_ << line + "\n" << std::flush;
}

void ScriptTranscript::end(ConnectionNumber connection) {
  open_.erase(connection);
  changed_.notify_all();
}

}  // namespace ostrel
