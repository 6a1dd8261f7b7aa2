// The command line. The parser's own exit codes become status 2.
#include "ostrelctl/Tool.h"

#include <CLI/CLI.hpp>
#include <functional>
#include <string>
#include <vector>

#include "ostrelctl/ChannelsCommand.h"
#include "ostrelctl/Commands.h"

namespace ostrel {
namespace {

/// The values that options are read into, and the command that was chosen.
struct Arguments {
  std::function<int()> command;
  bool json = false;
  std::string file = "-";
  SendOptions send;
  TailOptions tail;
  std::int64_t limit = 0;
  std::string session;
  std::string sql;
  std::optional<std::string> key;
  std::string neededKey;
  std::string value;
  ChannelsCommand channels;
};

CLI::App* addCommand(CLI::App& parent, Arguments& arguments, const std::string& name,
                     const std::string& description, std::function<int()> run) {
  CLI::App* command = parent.add_subcommand(name, description);
  command->callback([&arguments, run = std::move(run)] { arguments.command = run; });
  return command;
}

void addJSON(CLI::App* command, Arguments& arguments) {
  command->add_flag("--json", arguments.json, "Write JSON");
}

void addServiceCommands(CLI::App& app, const Tool& tool, Arguments& arguments) {
  auto* script = addCommand(app, arguments, "script",
                            "Send the requests of a script, one JSON object a line",
                            [&] { return runScript(tool, arguments.file); });
  script->add_option("FILE", arguments.file, "The script; standard input without it");

  auto* status =
      addCommand(app, arguments, "status", "Show whether the service runs, its sessions",
                 [&] { return runStatus(tool, arguments.json); });
  addJSON(status, arguments);

  auto* send = addCommand(app, arguments, "send", "Send one message",
                          [&] { return runSend(tool, arguments.send); });
  send->add_option("--category", arguments.send.category, "Code, such as 0x40000007")
      ->required();
  send->add_option("--type", arguments.send.type, "Code from 0 to 65535")->required();
  send->add_option("--reporter", arguments.send.reporterIDs,
                   "A session to send it to; may be given again. Without it, every "
                   "started session")
      ->allow_extra_args(false);
  send->add_option("--payload", arguments.send.payload, "The payload, a JSON object");
  send->add_option("--timeout", arguments.send.timeoutSeconds,
                   "Seconds to wait for the reply (5)")
      ->check(CLI::Range(0.0, 1e9));
  send->add_option("KEY=VALUE", arguments.send.entries,
                   "Entries of the payload; a value is JSON if it parses, else text");
  send->add_flag("--json", arguments.send.json, "Write JSON");
}

void addStoreCommands(CLI::App& app, const Tool& tool, Arguments& arguments) {
  auto* sessions =
      addCommand(app, arguments, "sessions", "List the recorded sessions",
                 [&] { return runSessions(tool, arguments.limit, arguments.json); });
  sessions->add_option("-n,--limit", arguments.limit, "Only the newest so many")
      ->check(CLI::PositiveNumber);
  addJSON(sessions, arguments);

  auto* show = addCommand(app, arguments, "show", "Show what one session recorded", [&] {
    return runShow(tool, arguments.session, arguments.json);
  });
  show->add_option("SESSION", arguments.session,
                   "The session as listed, a reporter's ID (its newest), or \"last\"")
      ->required();
  addJSON(show, arguments);

  auto* tail = addCommand(app, arguments, "tail", "Show messages as they are recorded",
                          [&] { return runTail(tool, arguments.tail); });
  tail->add_option("-n,--lines", arguments.tail.earlier,
                   "Begin with so many earlier ones")
      ->check(CLI::NonNegativeNumber);
  tail->add_option("--count", arguments.tail.count, "End after so many messages");
  tail->add_flag("--json", arguments.tail.json, "Write JSON, one object a line");

  auto* query = addCommand(app, arguments, "query", "Read the store with SQL",
                           [&] { return runQuery(tool, arguments.sql, arguments.json); });
  query->add_option("SQL", arguments.sql, "Statements that only read")->required();
  addJSON(query, arguments);
}

void addDefaultsCommands(CLI::App& app, const Tool& tool, Arguments& arguments) {
  auto* defaults = app.add_subcommand("defaults", "Edit the service's defaults");
  defaults->require_subcommand(1);

  auto* read =
      addCommand(*defaults, arguments, "read", "Print a default, or all of them",
                 [&] { return runDefaultsRead(tool, arguments.key, arguments.json); });
  read->add_option("KEY", arguments.key, "All of them without it");
  addJSON(read, arguments);

  auto* write = addCommand(*defaults, arguments, "write", "Set a default", [&] {
    return runDefaultsWrite(tool, arguments.neededKey, arguments.value);
  });
  write->add_option("KEY", arguments.neededKey, "Its name")->required();
  write->add_option("VALUE", arguments.value, "JSON if it parses, else text")->required();

  auto* remove = addCommand(*defaults, arguments, "delete", "Remove a default",
                            [&] { return runDefaultsDelete(tool, arguments.neededKey); });
  remove->add_option("KEY", arguments.neededKey, "Its name")->required();

  addCommand(app, arguments, "notify", "Have the service read its defaults again",
             [&] { return runNotify(tool); });
}

void addChannelsCommands(CLI::App& app, const Tool& tool, Arguments& arguments) {
  auto* channels = app.add_subcommand("channels", "Show or publish driver channels");
  channels->require_subcommand(1);
  const auto addGroups = [&arguments](CLI::App* command) {
    command->add_option("--group", arguments.channels.group, "Of this group");
    command->add_option("--subgroup", arguments.channels.subgroup, "Of this subgroup");
  };
  const auto run = [&] {
    return runChannels(arguments.channels, tool.channelsDirectory, tool.out, tool.err);
  };

  auto* list =
      addCommand(*channels, arguments, "list", "List counters and their values", run);
  addGroups(list);
  list->add_flag("--json", arguments.channels.asJSON, "Write JSON");

  auto* publish = addCommand(*channels, arguments, "publish", "Set counters", [&, run] {
    arguments.channels.action = ChannelsCommand::Action::kPublish;
    return run();
  });
  addGroups(publish);
  publish
      ->add_option("NAME=VALUE", arguments.channels.assignments,
                   "A counter and its value, an integer")
      ->required();
}

// What is wrong with the line. Of a command that there is not, the parser only says that
// one is missing.
std::string sentenceOf(const CLI::ParseError& error, const CLI::App& app) {
  const CLI::App* chosen = &app;
  while (!chosen->get_subcommands().empty()) chosen = chosen->get_subcommands().front();
  const std::vector<std::string> unknown = chosen->remaining();
  if (chosen->get_require_subcommand_min() != 0 && !unknown.empty() &&
      !unknown.front().starts_with('-')) {
    return "there is no command \"" + unknown.front() + '"';
  }
  return error.what();
}

}  // namespace

int runTool(const Tool& tool, int argc, const char* const* argv) {
  Arguments arguments;
  CLI::App app("Talk to the reporting service and read what it recorded", "ostrelctl");
  app.set_version_flag("--version", "ostrelctl " OSTREL_VERSION);
  app.require_subcommand(1);
  addServiceCommands(app, tool, arguments);
  addStoreCommands(app, tool, arguments);
  addDefaultsCommands(app, tool, arguments);
  addChannelsCommands(app, tool, arguments);
  try {
    app.parse(argc, argv);
  } catch (const CLI::ParseError& error) {
    // Help and the version are errors to the parser as well.
    if (error.get_exit_code() == 0) return app.exit(error, tool.out, tool.err);
    tool.fail(sentenceOf(error, app) + "; see \"ostrelctl --help\"");
    return Tool::kWrongUsage;
  }
  return arguments.command();
}

}  // namespace ostrel
