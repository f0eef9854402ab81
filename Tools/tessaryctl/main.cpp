// tessaryctl: one subcommand per command of the protocol.
#include <CLI/CLI.hpp>

#include "Client/Client.h"
#include "Tools/tessaryctl/Commands.h"

namespace {

struct CommandLine {
  CLI::App application{"Asks the container daemon."};
  Options options;
  Command chosen = nullptr;

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

  CLI::App* add(const char* name, const char* description, Command action) {
    CLI::App* command = application.add_subcommand(name, description);
    command->callback([this, action] { chosen = action; });
    return command;
  }

  // A subcommand that acts on the container of an identifier.
  CLI::App* addNamed(const char* name, const char* description, Command action) {
    CLI::App* command = add(name, description, action);
    command->add_option("identifier", options.identifier, "The container's identifier")->required();
    return command;
  }

  // One that asks for a class too.
  CLI::App* addOfClass(const char* name, const char* description, Command action) {
    CLI::App* command = addNamed(name, description, action);
    addClass(command);
    return command;
  }

  // One for one very container.
  CLI::App* addConcrete(const char* name, const char* description, Command action) {
    CLI::App* command = addOfClass(name, description, action);
    command->add_option("--uuid", options.uuid, "Which one, when several have the identifier");
    return command;
  }

  void addOwnIdentifier(CLI::App* command) {
    command->add_option("identifier", options.identifier, "Default: the caller's own identifier");
  }

  void addTransient(CLI::App* command) {
    command->add_flag("--transient", options.transient, "The transient variant");
  }

  void addClass(CLI::App* command) {
    command->add_option("--class", options.containerClass, "The container class, 1 to 13")
        ->required();
  }

  void addCommands() {
    addLookups();
    addRemovals();
    addQueries();
    add("personas", "List the personas that the caller may see (command 32)", command::personas);
    add("retired", "Send the retired command 27", command::retired);
  }

  void addLookups() {
    CLI::App* create = add("create", "Find a container, or create it (command 0)", command::create);
    CLI::App* lookup = add("lookup", "Find a container (command 0)", command::lookup);
    CLI::App* list = add("list", "List the containers of a class (command 1)", command::list);
    for (CLI::App* command : {create, lookup}) addOwnIdentifier(command);
    for (CLI::App* command : {create, lookup, list}) {
      addClass(command);
      addTransient(command);
    }
    addOwnIdentifier(
        add("system-path", "The path of a system container (command 15)", command::systemPath));
  }

  void addRemovals() {
    addConcrete("replace", "Put the transient container in the regular one's place (command 2)",
                command::replace);
    addConcrete("promote", "Make the transient container the regular one (command 2)",
                command::promote);
    addTransient(addConcrete("stage-for-delete", "Take a container out of sight (command 3)",
                             command::stageForDelete));
    add("empty-death-row", "Wait until what was deleted is gone (command 4)",
        command::emptyDeathRow);
    addOfClass("delete", "Delete a container (command 10)", command::deleteContainer);
    addNamed("wipe-plugin-data", "Empty a plug-in's data container (command 11)",
             command::wipePluginData);
    addOfClass("delete-content", "Empty a container under a user's home (command 12)",
               command::deleteContent);
  }

  void addQueries() {
    CLI::App* setInfo =
        addConcrete("set-info", "Set or remove an info value (command 5)", command::setInfo);
    CLI::App* getInfo =
        addConcrete("get-info", "Print an info value (command 6)", command::getInfo);
    for (CLI::App* command : {setInfo, getInfo}) {
      command->add_option("key", options.key, "The value's key")->required();
    }
    setInfo->add_option("value", options.json, "JSON; without one the key is removed");
    for (CLI::App* command :
         {setInfo, getInfo,
          addConcrete("metadata", "Where a container is, and its info (command 7)",
                      command::metadata),
          addConcrete("recreate-structure", "Make missing directories anew (command 8)",
                      command::recreateStructure),
          addConcrete("regenerate-uuid", "Give the directory a new name (command 9)",
                      command::regenerateUUID),
          addConcrete("disk-usage", "The bytes that a container takes (command 23)",
                      command::diskUsage)}) {
      addTransient(command);
    }
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
  auto client = tessary::Client::connect(line.options.record.root);
  if (!client) return complain(client.error());
  return line.chosen(*client, line.options);
}
