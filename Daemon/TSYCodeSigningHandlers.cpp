// Commands of the installer about code-signing information.
#include "Daemon/TSYCodeSigningMapping.h"
#include "Daemon/TSYCommandHandlers.h"
#include "Daemon/TSYPropertyList.h"
#include "Daemon/TSYRequestResolvers.h"

using platform::Value;

uint64_t TSYHandleRegisterCodeSigningInfo(TSYRelayEvent& event, TSYClientConnection& connection) {
  const auto identifier =
      TSYResolveIdentifier(event.request, connection, TSYIdentifierFallback::none);
  TSYCodeSigningMapping::Info info;
  if (const Value::Dictionary* given = event.request.dictionary("CodeSigningInfo")) {
    // What cannot be stored must not count as registered.
    if (identifier && !TSYHasPropertyListForm(*given)) return TSYErrorInvalidArgument;
    info = std::make_shared<const Value::Dictionary>(*given);
  }
  const Value::Dictionary* options = event.request.dictionary("OptionsDictionary");
  return TSYCodeSigningMapping::sharedInstance().processCodeSigningInfo(
      info, identifier, options == nullptr ? Value::Dictionary() : *options,
      connection.commandQueue());
}

uint64_t TSYHandleGetCodeSigningInfo(TSYRelayEvent& event, TSYClientConnection& connection) {
  const auto identifier =
      TSYResolveIdentifier(event.request, connection, TSYIdentifierFallback::none);
  if (!identifier) return TSYErrorMissingIdentifier;
  const auto info =
      TSYCodeSigningMapping::sharedInstance().getCodeSigningInfoForIdentifier(*identifier);
  if (!info) return TSYErrorNotFound;
  event.reply.set("ReplyInfoDictionary", *info);
  return TSYErrorSuccess;
}

uint64_t TSYHandleInvalidateCodeSigningInfo(TSYRelayEvent& /*event*/,
                                            TSYClientConnection& /*connection*/) {
  return TSYCodeSigningMapping::sharedInstance()
      .invalidateCodeSigningInfoForAppsWithoutBundleContainer();
}
