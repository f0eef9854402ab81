// What the subcommands do: each makes one call, prints its result and returns the exit status.
#pragma once

#include <cstdint>
#include <optional>
#include <string>

#include "Client/Client.h"
#include "Tools/tessaryctl/Output.h"
#include "Tools/tessaryctl/OwnRecord.h"

// What `register` is to register: one of the files, or nothing to forget the identifier.
struct Registration {
  std::optional<std::string> infoFile;
  std::optional<std::string> entitlementsFile;
  tessary::RegistrationOptions options;
};

// The options of all subcommands; each reads its own.
struct Options {
  OwnRecordOptions record;
  Output output;
  std::optional<std::string> identifier;
  uint64_t containerClass = 0;
  bool transient = false;
  // Which one, when several personas have a container of the identifier.
  std::optional<std::string> uuid;
  std::optional<std::string> ownerPersona;
  std::string key;
  std::optional<std::string> json;  // an info value
  std::optional<std::string> owner;
  Registration registration;
  // Relative to a container, or to the directory for assets.
  std::string source;
  std::string destination;
  tessary::UserManagedAssetsOptions assets;
};

using Command = int (*)(tessary::Client&, const Options&);

namespace command {

int create(tessary::Client& client, const Options& options);
int lookup(tessary::Client& client, const Options& options);
int list(tessary::Client& client, const Options& options);
int replace(tessary::Client& client, const Options& options);
int promote(tessary::Client& client, const Options& options);
int stageForDelete(tessary::Client& client, const Options& options);
int emptyDeathRow(tessary::Client& client, const Options& options);
int setInfo(tessary::Client& client, const Options& options);
int getInfo(tessary::Client& client, const Options& options);
int metadata(tessary::Client& client, const Options& options);
int recreateStructure(tessary::Client& client, const Options& options);
int regenerateUUID(tessary::Client& client, const Options& options);
int deleteContainer(tessary::Client& client, const Options& options);
int wipePluginData(tessary::Client& client, const Options& options);
int deleteContent(tessary::Client& client, const Options& options);
int systemPath(tessary::Client& client, const Options& options);
int groups(tessary::Client& client, const Options& options);
int groupIdentifiers(tessary::Client& client, const Options& options);
int systemGroups(tessary::Client& client, const Options& options);
int systemGroupPath(tessary::Client& client, const Options& options);
int registerInfo(tessary::Client& client, const Options& options);
int codeSigningInfo(tessary::Client& client, const Options& options);
int invalidate(tessary::Client& client, const Options& options);
int diskUsage(tessary::Client& client, const Options& options);
int stageSharedContent(tessary::Client& client, const Options& options);
int assetsPath(tessary::Client& client, const Options& options);
int deleteAsset(tessary::Client& client, const Options& options);
int retired(tessary::Client& client, const Options& options);
int personas(tessary::Client& client, const Options& options);

}  // namespace command
