#include <fmt/format.h>

#include "Tools/PropertyListFile.h"
#include "Tools/tessaryctl/Commands.h"
#include "Tools/tessaryctl/Finish.h"
#include "Tools/tessaryctl/ValueJSON.h"

using platform::Value;
using tessary::Client;

namespace {

int complainOf(const char* option, const std::string& file, const std::string& reason) {
  return complain(fmt::format("{} {}: {}", option, file, reason));
}

}  // namespace

namespace command {

int registerInfo(Client& client, const Options& options) {
  const Registration& registration = options.registration;
  std::optional<Value::Dictionary> info;
  if (registration.infoFile) {
    auto read = readDictionaryFile(*registration.infoFile);
    if (!read) return complainOf("--info", *registration.infoFile, read.error());
    info = *std::move(read);
  } else if (registration.entitlementsFile) {
    auto read = readDictionaryFile(*registration.entitlementsFile);
    if (!read) return complainOf("--entitlements", *registration.entitlementsFile, read.error());
    info = Value::Dictionary{{tessary::kEntitlementsKey, *std::move(read)}};
  }
  return finish(
      client.registerCodeSigningInfo(options.identifier.value_or(""), info, registration.options));
}

int codeSigningInfo(Client& client, const Options& options) {
  return finish(client.codeSigningInfo(options.identifier.value_or("")),
                [](const Value::Dictionary& info) { fmt::print("{}\n", jsonOfValue(info)); });
}

int invalidate(Client& client, const Options& /*options*/) {
  return finish(client.invalidateCodeSigningInfo());
}

}  // namespace command
