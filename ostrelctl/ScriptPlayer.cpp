#include "ostrelctl/ScriptPlayer.h"

#include <algorithm>
#include <utility>
#include <vector>

#include "ostrelctl/JSONNode.h"

namespace ostrel {

ScriptPlayer::ScriptPlayer(ServiceConnector connect, ToolClock& clock, std::ostream& out,
                           std::ostream& err)
    : connect_(std::move(connect)),
      clock_(clock),
      out_(out),
      err_(err),
      transcript_(std::make_shared<ScriptTranscript>(out, clock)) {}

ScriptPlayer::~ScriptPlayer() { endAllConnections(); }

int ScriptPlayer::play(std::istream& in) {
  std::string text;
  while (std::getline(in, text)) {
    ++line_;
    if (isBlankLine(text)) continue;
    if (const auto status = playLine(text)) {
      endAllConnections();
      return *status;
    }
  }
  endAllConnections();
  transcript_->printUnanswered();
  if (out_) return 0;
  err_ << "ostrelctl: the replies could not be written\n";
  return 1;
}

std::optional<int> ScriptPlayer::playLine(std::string_view text) {
  const ScriptLine line = parseScriptLine(text);
  if (!line.command) {
    complain(line.error);
    return 2;
  }
  for (const std::string& member : line.ignoredMembers) {
    complain(inQuotes(member) + " is ignored");
  }
  return std::visit([this](const auto& command) { return act(command); }, *line.command);
}

std::optional<int> ScriptPlayer::act(const ScriptRequest& request) {
  const auto service = connection(request.client);
  if (!service) return 1;
  transcript_->requestSent(line_, request.client, request.operation,
                           connections_.at(request.client).number);
  request.send(*service, [transcript = transcript_, line = line_, client = request.client,
                          operation = request.operation](const std::string& member) {
    transcript->requestAnswered(line, client, operation, member);
  });
  return std::nullopt;
}

std::optional<int> ScriptPlayer::act(const ScriptWait& command) {
  transcript_->wait(command.longest);
  return std::nullopt;
}

std::optional<int> ScriptPlayer::act(const ScriptSleep& command) {
  clock_.sleep(command.duration);
  return std::nullopt;
}

std::optional<int> ScriptPlayer::act(const ScriptClose& command) {
  endConnection(command.client, Ending::kClose);
  return std::nullopt;
}

std::optional<int> ScriptPlayer::act(const ScriptAbort& command) {
  endConnection(command.client, Ending::kAbort);
  return std::nullopt;
}

std::shared_ptr<ServiceConnection> ScriptPlayer::connection(const std::string& client) {
  const auto found = connections_.find(client);
  if (found != connections_.end()) {
    if (transcript_->isOpen(found->second.number)) return found->second.service;
    connections_.erase(found);
  }
  auto connected = connect_();
  if (!connected.value) {
    complain(connected.error ? connected.error->description : "there is no service");
    return nullptr;
  }
  const auto number = connectionsOpened_++;
  transcript_->connectionOpened(number);
  (*connected.value)
      ->setClosedHandler(
          [transcript = transcript_, number, client](const std::string& reason) {
            transcript->connectionClosed(number, client, reason);
          });
  connections_.emplace(client, Connection{number, *connected.value});
  return *connected.value;
}

void ScriptPlayer::endConnection(const std::string& client, Ending ending) {
  const auto found = connections_.find(client);
  if (found == connections_.end()) return;
  const Connection connection = std::move(found->second);
  connections_.erase(found);
  if (ending == Ending::kClose) {
    connection.service->close();
  } else {
    connection.service->abort();
  }
  transcript_->connectionEnded(connection.number);
}

void ScriptPlayer::endAllConnections() {
  std::vector<std::pair<ScriptTranscript::ConnectionNumber, std::string>> inOrder;
  for (const auto& [client, connection] : connections_) {
    inOrder.emplace_back(connection.number, client);
  }
  std::sort(inOrder.begin(), inOrder.end());
  for (const auto& [number, client] : inOrder) endConnection(client, Ending::kClose);
}

void ScriptPlayer::complain(const std::string& what) {
  err_ << "ostrelctl: line " + std::to_string(line_) + ": " + what + "\n" << std::flush;
}

}  // namespace ostrel
