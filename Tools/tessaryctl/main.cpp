// tessaryctl: one subcommand per command of the protocol.

#include <CLI/CLI.hpp>
#include <functional>

#include "Client/Client.h"
#include "Tools/tessaryctl/Output.h"
#include "Tools/tessaryctl/OwnRecord.h"

namespace {

using tessary::Client;

// The options of all subcommands; each reads its own.
struct Options {
  OwnRecordOptions record;
  Output output;
  std::optional<std::string> identifier;
  uint64_t containerClass = 0;
  bool transient = false;
};

using Action = std::function<int(Client&, const Options&)>;

// Prints the result of a call, or what went wrong.
template <typename T, typename Print>
int finish(const tessary::Result<T>& result, Print&& print) {
  if (!result) return complain(result.error());
  if constexpr (!std::is_void_v<T>) print(*result);
  return kDone;
}

int createOrLookup(Client& client, const Options& options, bool createIfNecessary) {
  const auto container = client.createOrLookup(
      options.identifier, options.containerClass,
      {.createIfNecessary = createIfNecessary, .transient = options.transient});
  return finish(container, [&](const auto& found) { options.output.print(found); });
}

int create(Client& client, const Options& options) {
  return createOrLookup(client, options, /*createIfNecessary=*/true);
}

int lookup(Client& client, const Options& options) {
  return createOrLookup(client, options, /*createIfNecessary=*/false);
}

int list(Client& client, const Options& options) {
  return finish(client.containersOfClass(options.containerClass, options.transient),
                [&](const auto& containers) { options.output.print(containers); });
}

int systemPath(Client& client, const Options& options) {
  return finish(client.systemContainerPath(options.identifier),
                [&](const std::string& path) { options.output.print("path", path); });
}

int personas(Client& client, const Options& options) {
  return finish(client.personaList(),
                [&](const auto& texts) { options.output.print("personas", texts); });
}

int retired(Client& client, const Options& /*options*/) {
  return finish(client.retired(), [](auto&&...) {});
}

struct CommandLine {
  CLI::App application{"Asks the container daemon."};
  Options options;
  Action chosen;

  CommandLine() {
    application.require_subcommand(1);
    application.fallthrough();
    application.add_option("--root", options.record.root, "The directory that stands for /")
        ->default_val("/");
    application.add_flag("--json", options.output.json, "Print JSON");
    application.add_option("--identifier", options.record.identifier,
                           "Ask as a process with this code-signing identifier");
    application.add_option("--entitlements", options.record.entitlementsFile,
                           "Ask with the entitlements in this property list");
    application.add_flag("--sandboxed", options.record.sandboxed, "Ask as a sandboxed process");
    application.add_option("--persona", options.record.persona, "Ask in this persona");
    addCommands();
  }

  CLI::App* add(const char* name, const char* description, Action action) {
    CLI::App* command = application.add_subcommand(name, description);
    command->callback([this, action = std::move(action)] { chosen = action; });
    return command;
  }

  void addIdentifier(CLI::App* command) {
    command->add_option("identifier", options.identifier, "Default: the caller's own identifier");
  }

  void addClass(CLI::App* command) {
    command->add_option("--class", options.containerClass, "The container class, 1 to 13")
        ->required();
    command->add_flag("--transient", options.transient, "The transient variant");
  }

  void addCommands() {
    CLI::App* command = add("create", "Find a container, or create it (command 0)", create);
    addIdentifier(command);
    addClass(command);
    command = add("lookup", "Find a container (command 0)", lookup);
    addIdentifier(command);
    addClass(command);
    addClass(add("list", "List the containers of a class (command 1)", list));
    addIdentifier(add("system-path", "The path of a system container (command 15)", systemPath));
    add("personas", "List the personas that the caller may see (command 32)", personas);
    add("retired", "Send the retired command 27", retired);
  }
};

}  // namespace

int main(int argc, char** argv) {
  CommandLine line;
  try {
    line.application.parse(argc, argv);
  } catch (const CLI::ParseError& error) {
    return line.application.exit(error) == 0 ? kDone : kUnusable;
  }
  if (const auto problem = writeOwnRecord(line.options.record)) return complain(*problem);
  auto client = Client::connect(line.options.record.root);
  if (!client) return complain(client.error());
  return line.chosen(*client, line.options);
}
