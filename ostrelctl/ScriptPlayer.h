#pragma once

#include <cstdint>
#include <functional>
#include <istream>
#include <map>
#include <memory>
#include <ostream>
#include <string>
#include <string_view>

#include "client/ServiceConnection.h"
#include "ostrelctl/ScriptLine.h"
#include "ostrelctl/ScriptTranscript.h"

namespace ostrel {

/// Makes a connection to the service, or says in a sentence why there is none.
using ServiceConnector = std::function<Outcome<std::shared_ptr<ServiceConnection>>()>;

/// Plays one script: acts on each line as soon as it is read, prints each reply
/// as it comes.
///
/// A connection is opened when a request first names it, and anew when a
/// request names it after it was closed by either side. `close` and `abort` of a
/// connection that is not open do nothing. A wait ends at once for requests whose
/// connection is closed: nothing can answer them.
class ScriptPlayer {
 public:
  /// Replies go to `out`, sentences for people to `err`. Both, and `clock`,
  /// outlive the player.
  ScriptPlayer(ServiceConnector connect, ToolClock& clock, std::ostream& out,
               std::ostream& err);
  /// Ends the connections that are still open well.
  ~ScriptPlayer();

  /// Plays `in` to its end. Returns the exit status: 0; 1 when there is no
  /// service or `out` cannot be written; 2 when a line is wrong.
  int play(std::istream& in);

 private:
  struct Connection {
    ScriptTranscript::ConnectionNumber number;
    std::shared_ptr<ServiceConnection> service;
  };
  enum class Ending { kClose, kAbort };

  /// The exit status when the line ends the script.
  std::optional<int> playLine(std::string_view text);
  std::optional<int> act(const ScriptRequest& request);
  std::optional<int> act(const ScriptWait& command);
  std::optional<int> act(const ScriptSleep& command);
  std::optional<int> act(const ScriptClose& command);
  std::optional<int> act(const ScriptAbort& command);

  /// The open connection of that name. None, with a sentence, without a service.
  std::shared_ptr<ServiceConnection> connection(const std::string& client);
  void endConnection(const std::string& client, Ending ending);
  void endAllConnections();
  void complain(const std::string& what);

  const ServiceConnector connect_;
  ToolClock& clock_;
  std::ostream& out_;
  std::ostream& err_;
  // Reply callbacks keep it too.
  const std::shared_ptr<ScriptTranscript> transcript_;

  std::uint64_t line_ = 0;
  ScriptTranscript::ConnectionNumber connectionsOpened_ = 0;
  std::map<std::string, Connection> connections_;  // Those not ended by the script.
};

}  // namespace ostrel
