// persona list, add, remove, replace-file: the user-management service's list. Every change is
// checked as the daemon would check it and renamed into place, so no reader sees half a list.
#include <algorithm>
#include <vector>

#include "Platform/os/Accounts.h"
#include "Platform/os/ConfigurationFile.h"
#include "Platform/os/PersonaList.h"
#include "Platform/os/RuntimeDirectory.h"
#include "Platform/values/PropertyList.h"
#include "Tools/PropertyListFile.h"
#include "Tools/tessary-platform/Command.h"

namespace {

using platform::FileSystem;
using platform::Value;

struct NewPersona {
  std::string uniqueString;
  uint32_t personaID = 0;
  std::string kind;
  std::string layoutPath;
  std::vector<std::string> bundleIdentifiers;
};

int complainOfList(const std::string& reason) {
  return complain(kFailed, fmt::format("the list of personas: {}", reason));
}

// The entries as they stand, with keys that mean nothing here; none when there is no list.
platform::Result<Value::Array> readList(const FileSystem& files) {
  auto value = platform::readConfigurationFile(files, platform::personaListPath(files));
  if (!value && value.error().value == ENOENT) return Value::Array();
  if (!value) return std::unexpected(value.error());
  if (value->asArray() == nullptr) return platform::failWith(EINVAL);
  return std::move(*value->asArray());
}

int writeList(const FileSystem& files, const Value& list) {
  if (const auto parsed = platform::parsePersonaList(list, files.root()); !parsed) {
    return complainOfList(parsed.error());
  }
  const auto bytes = platform::writeBinaryPropertyList(list);
  if (!bytes) return complainOfList(bytes.error().reason);
  auto written = files.makePath(platform::configurationDirectory(files), 0755);
  if (written) {
    written = files.writeFile(platform::personaListPath(files), *bytes, {.atomic = true});
  }
  return written ? kDone : complainOfList(written.error().message());
}

bool hasText(const Value& persona, const char* key, std::string_view text) {
  const Value* value = persona.find(key);
  return value != nullptr && value->asString() != nullptr && *value->asString() == text;
}

bool isPersonal(const Value& persona) {
  return hasText(persona, platform::persona_key::kKind, "personal");
}

Value personaFromOptions(const NewPersona& options) {
  Value::Dictionary persona{
      {platform::persona_key::kUniqueString, options.uniqueString},
      {platform::persona_key::kPersonaID, options.personaID},
      {platform::persona_key::kKind, options.kind},
  };
  if (!options.layoutPath.empty()) {
    persona[platform::persona_key::kLayoutPath] = options.layoutPath;
  }
  if (!options.bundleIdentifiers.empty()) {
    Value::Array identifiers(options.bundleIdentifiers.begin(), options.bundleIdentifiers.end());
    persona[platform::persona_key::kBundleIdentifiers] = std::move(identifiers);
  }
  return persona;
}

// The user whose personas these are has a personal one always; its id is the user's own.
Value personalPersona(const FileSystem& files) {
  const auto mobile = platform::Accounts(files).accountNamed("mobile");
  return Value::Dictionary{
      {platform::persona_key::kUniqueString, platform::UUID::random().string()},
      {platform::persona_key::kPersonaID, mobile ? mobile->uid : kMobileUID},
      {platform::persona_key::kKind, "personal"},
  };
}

int add(const FileSystem& files, const NewPersona& options) {
  auto list = readList(files);
  if (!list) return complainOfList(list.error().message());
  list->push_back(personaFromOptions(options));
  if (std::ranges::none_of(*list, isPersonal)) {
    list->insert(list->begin(), personalPersona(files));
  }
  return writeList(files, *std::move(list));
}

int remove(const FileSystem& files, const std::string& uniqueString) {
  auto list = readList(files);
  if (!list) return complainOfList(list.error().message());
  const size_t removed = std::erase_if(*list, [&](const Value& persona) {
    return hasText(persona, platform::persona_key::kUniqueString, uniqueString);
  });
  if (removed == 0) return complain(kFailed, fmt::format("no persona {}", uniqueString));
  if (list->empty()) {
    const auto gone = files.remove(platform::personaListPath(files), nullptr);
    return gone ? kDone : complainOfList(gone.error().message());
  }
  if (std::ranges::none_of(*list, isPersonal)) {
    return complainOfList("the personal persona goes last");
  }
  return writeList(files, *std::move(list));
}

int replaceFile(const FileSystem& files, const std::string& path) {
  const auto list = readPropertyListFile(path);
  if (!list) return complain(kBadUsage, fmt::format("{}: {}", path, list.error()));
  return writeList(files, *list);
}

int list(const FileSystem& files) {
  const auto value = platform::readConfigurationFile(files, platform::personaListPath(files));
  if (!value && value.error().value == ENOENT) return kDone;
  if (!value) return complainOfList(value.error().message());
  const auto personas = platform::parsePersonaList(*value, files.root());
  if (!personas) return complainOfList(personas.error());
  for (const auto& persona : *personas) fmt::print("{}\n", persona.description());
  return kDone;
}

// Two changes at once would lose one.
template <typename Change>
int change(const Application& application, const Change& apply) {
  const auto files = openPreparedRoot(application);
  if (files == nullptr) return kFailed;
  const auto lock = platform::lockRuntimeDirectory(*files);
  if (!lock) return complainOfList(lock.error().message());
  return apply(*files);
}

void addAddCommand(Application& application, CLI::App& personas) {
  auto* const command =
      personas.add_subcommand("add", "Add a persona, and a personal one when there is none yet");
  const auto options = std::make_shared<NewPersona>();
  command->add_option("--unique-string", options->uniqueString, "What names it")->required();
  command->add_option("--id", options->personaID, "Its number in the kernel")->required();
  command->add_option("--kind", options->kind, "personal, enterprise, universal or system")
      ->required();
  command->add_option("--layout-path", options->layoutPath, "Its home, below the root");
  command->add_option("--bundle", options->bundleIdentifiers, "An application of its own")
      ->take_all();
  command->callback([&application, options] {
    application.chosen = [&application, options] {
      return change(application, [&](const FileSystem& files) { return add(files, *options); });
    };
  });
}

// A command with one argument.
void addArgumentCommand(Application& application, CLI::App& personas, const char* name,
                        const char* description, const char* argumentName,
                        int (*apply)(const FileSystem&, const std::string&)) {
  auto* const command = personas.add_subcommand(name, description);
  const auto argument = std::make_shared<std::string>();
  command->add_option(argumentName, *argument)->required();
  command->callback([&application, argument, apply] {
    application.chosen = [&application, argument, apply] {
      return change(application, [&](const FileSystem& files) { return apply(files, *argument); });
    };
  });
}

}  // namespace

void addPersonaCommands(Application& application) {
  auto* const personas = application.cli.add_subcommand("persona", "The personas of the user");
  personas->require_subcommand(1);
  personas->add_subcommand("list", "Show them")->callback([&application] {
    application.chosen = [&application] {
      const auto files = openRoot(application);
      return files == nullptr ? kFailed : list(*files);
    };
  });
  addAddCommand(application, *personas);
  addArgumentCommand(application, *personas, "remove", "Remove one", "unique-string", remove);
  addArgumentCommand(application, *personas, "replace-file",
                     "Put a whole list, binary or XML, in place of what is there", "file",
                     replaceFile);
}
