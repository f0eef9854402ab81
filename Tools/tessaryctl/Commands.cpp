#include "Tools/tessaryctl/Commands.h"

#include <fmt/format.h>

#include "Tools/tessaryctl/Finish.h"
#include "Tools/tessaryctl/ValueJSON.h"

using tessary::Client;
using tessary::ContainerName;

namespace {

int createOrLookup(Client& client, const Options& options, bool createIfNecessary) {
  const auto container = client.createOrLookup(
      options.identifier, options.containerClass,
      {.createIfNecessary = createIfNecessary, .transient = options.transient});
  return finish(container, [&](const auto& found) { options.output.print(found); });
}

// The one listed container of the identifier, of the UUID when one is given. Otherwise complains.
std::optional<ContainerName> choose(Client& client, const Options& options, bool transient) {
  const auto listed = client.containersOfClass(options.containerClass, transient);
  if (!listed) {
    complain(listed.error());
    return std::nullopt;
  }
  std::optional<ContainerName> chosen;
  for (const auto& container : *listed) {
    if (container.identifier != options.identifier) continue;
    if (options.uuid && container.uuid != platform::UUID::parse(*options.uuid)) continue;
    if (options.ownerPersona && container.personaUniqueString != *options.ownerPersona) continue;
    if (chosen) {
      complain("several containers have this identifier: choose one with --uuid");
      return std::nullopt;
    }
    chosen = {container.identifier, options.containerClass, container.uuid, std::nullopt};
    if (!container.personaUniqueString.empty()) {
      chosen->personaUniqueString = container.personaUniqueString;
    }
  }
  if (!chosen) complain("there is no such container");
  return chosen;
}

// Runs `call` with the chosen container.
template <typename Call>
int withContainer(Client& client, const Options& options, Call&& call) {
  const auto container = choose(client, options, options.transient);
  return container ? call(*container) : kRefused;
}

}  // namespace

namespace command {

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

int replace(Client& client, const Options& options) {
  const auto old = choose(client, options, /*transient=*/false);
  if (!old) return kRefused;
  Options ofNew = options;
  ofNew.uuid.reset();
  ofNew.ownerPersona = old->personaUniqueString;
  const auto replacement = choose(client, ofNew, /*transient=*/true);
  return replacement ? finish(client.replaceContainer(*old, *replacement)) : kRefused;
}

int promote(Client& client, const Options& options) {
  const auto transient = choose(client, options, /*transient=*/true);
  return transient ? finish(client.promoteContainer(*transient)) : kRefused;
}

int stageForDelete(Client& client, const Options& options) {
  return withContainer(client, options, [&](const ContainerName& container) {
    return finish(client.stageForDelete({container}));
  });
}

int emptyDeathRow(Client& client, const Options& /*options*/) {
  return finish(client.emptyDeathRow());
}

int setInfo(Client& client, const Options& options) {
  std::optional<platform::Value> value;
  if (options.json) {
    auto parsed = valueOfJSON(*options.json);
    if (!parsed) return complain(parsed.error());
    value = std::move(*parsed);
  }
  return withContainer(client, options, [&](const ContainerName& container) {
    return finish(client.setInfoValue(container, options.key, value));
  });
}

int getInfo(Client& client, const Options& options) {
  return withContainer(client, options, [&](const ContainerName& container) {
    return finish(client.infoValue(container, options.key),
                  [](const platform::Value& value) { fmt::print("{}\n", jsonOfValue(value)); });
  });
}

int metadata(Client& client, const Options& options) {
  return withContainer(client, options, [&](const ContainerName& container) {
    return finish(client.metadata(container, /*infoRequested=*/true),
                  [&](const tessary::Metadata& found) { options.output.print(found); });
  });
}

int recreateStructure(Client& client, const Options& options) {
  return withContainer(client, options, [&](const ContainerName& container) {
    return finish(client.recreateStructure(container));
  });
}

int regenerateUUID(Client& client, const Options& options) {
  return withContainer(client, options, [&](const ContainerName& container) {
    return finish(client.regenerateUUID(container));
  });
}

int deleteContainer(Client& client, const Options& options) {
  return finish(client.deleteContainer(options.identifier.value_or(""), options.containerClass,
                                       options.transient));
}

int wipePluginData(Client& client, const Options& options) {
  return finish(client.wipePluginData(options.identifier.value_or("")));
}

int deleteContent(Client& client, const Options& options) {
  return finish(client.deleteDataContent(options.identifier.value_or(""), options.containerClass));
}

int systemPath(Client& client, const Options& options) {
  return finish(client.systemContainerPath(options.identifier),
                [&](const std::string& path) { options.output.print("path", path); });
}

int diskUsage(Client& client, const Options& options) {
  return withContainer(client, options, [&](const ContainerName& container) {
    return finish(client.diskUsage(container),
                  [&](uint64_t bytes) { options.output.print("bytes", fmt::format("{}", bytes)); });
  });
}

int retired(Client& client, const Options& /*options*/) {
  return finish(client.retired());
}

int personas(Client& client, const Options& options) {
  return finish(client.personaList(),
                [&](const auto& texts) { options.output.print("personas", texts); });
}

}  // namespace command
