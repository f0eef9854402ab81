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

  // A subcommand that acts on an identifier, most often on its container.
  CLI::App* addNamed(const char* name, const char* description, Command action,
                     const char* identifier = "The container's identifier") {
    CLI::App* command = add(name, description, action);
    command->add_option("identifier", options.identifier, identifier)->required();
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

  // One that asks about what an owner has.
  void addOwned(const char* name, const char* description, Command action) {
    add(name, description, action)
        ->add_option("owner", options.identifier, "Default: the caller's own identifier");
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
    addGroups();
    addCodeSigning();
    addSharedContent();
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

  void addGroups() {
    addOwned("groups", "The containers of an owner's application groups (command 13)",
             command::groups);
    addOwned("group-ids", "An owner's application groups (command 14)", command::groupIdentifiers);
    addOwned("system-groups", "The containers of an owner's system groups (command 16)",
             command::systemGroups);
    CLI::App* path = add("system-group-path", "The path of a system group's container (command 17)",
                         command::systemGroupPath);
    path->add_option("group", options.identifier, "The group's identifier")->required();
    path->add_option("--owner", options.owner, "Default: the caller's own identifier");
  }

  void addCodeSigning() {
    addRegister();
    addNamed("code-signing-info", "Print what an identifier is registered with (command 19)",
             command::codeSigningInfo, "The code-signing identifier");
    add("invalidate", "Invalidate entries without a bundle container (command 20)",
        command::invalidate);
  }

  void addRegister() {
    CLI::App* command =
        addNamed("register", "Register what an identifier is entitled to (command 18)",
                 command::registerInfo, "The code-signing identifier");
    Registration& registration = options.registration;
    auto* what = command->add_option_group("What to register");
    what->require_option(1);
    what->add_option("--info", registration.infoFile,
                     "A property list: the code-signing information");
    what->add_option("--entitlements", registration.entitlementsFile,
                     "A property list: the entitlements alone. Those to ask with stand before the "
                     "subcommand");
    CLI::Option* forget = what->add_flag("--forget")->description("Forget the identifier");
    for (CLI::Option* option :
         {command->add_option("--class", registration.options.dataContainerClass,
                              "The class of its data container"),
          command->add_option("--parent", registration.options.parentIdentifier,
                              "The application whose plug-in it is"),
          command->add_flag("--placeholder", registration.options.placeholder,
                            "It is not installed yet"),
          command->add_flag("--advance-copy", registration.options.advanceCopy,
                            "The same, until the next start of the device"),
          command->add_flag("--by-caller", registration.options.registeredByCaller,
                            "Its own process may change it")}) {
      option->excludes(forget);
    }
  }

  void addSharedContent() {
    CLI::App* stage =
        add("stage-shared", "Move an item within a system group's container (command 26)",
            command::stageSharedContent);
    stage->add_option("group", options.identifier, "One of the caller's own system groups")
        ->required();
    stage->add_option("source", options.source, "Relative to the container")->required();
    stage->add_option("destination", options.destination, "Relative to the container")->required();
    CLI::App* path = addNamed("assets-path", "The directory for user-managed assets (command 28)",
                              command::assetsPath);
    path->add_flag("--relative", options.assets.isRelative, "Relative to the container");
    path->add_flag("--create", options.assets.createIfNecessary, "Make it when it is not there");
    addNamed("delete-asset", "Delete a user-managed asset (command 29)", command::deleteAsset)
        ->add_option("path", options.source, "Relative to the directory for assets")
        ->required();
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
