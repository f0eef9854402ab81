// What the subcommands do: each makes one call, prints its result and returns the exit status.
#pragma once

#include <cstdint>
#include <optional>
#include <string>

#include "Client/Client.h"
#include "Tools/tessaryctl/Output.h"
#include "Tools/tessaryctl/OwnRecord.h"

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
int diskUsage(tessary::Client& client, const Options& options);
int retired(tessary::Client& client, const Options& options);
int personas(tessary::Client& client, const Options& options);

}  // namespace command
