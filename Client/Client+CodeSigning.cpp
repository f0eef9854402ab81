#include "Client/Client.h"
#include "Client/Wire.h"

using platform::Value;
using platform::ipc::Message;

namespace tessary {
namespace {

constexpr char kInfo[] = "ReplyInfoDictionary";

Value::Dictionary dictionaryOf(const RegistrationOptions& options) {
  Value::Dictionary dictionary = {
      {"com.veltra.Tessary.DataContainerClass", options.dataContainerClass},
      {"com.veltra.Tessary.PlaceholderEntitlements", options.placeholder},
      {"com.veltra.Tessary.AdvanceCopy", options.advanceCopy},
      {"RegByCaller", options.registeredByCaller}};
  if (options.parentIdentifier) {
    dictionary.emplace("com.veltra.Tessary.ParentBundleID", *options.parentIdentifier);
  }
  return dictionary;
}

}  // namespace

Result<void> Client::registerCodeSigningInfo(const std::string& identifier,
                                             const std::optional<Value::Dictionary>& info,
                                             const RegistrationOptions& options) {
  Message request;
  request.set("Identifier", identifier);
  if (info) request.set("CodeSigningInfo", *info);
  request.set("OptionsDictionary", dictionaryOf(options));
  return callForNothing(kRegisterCodeSigningInfo, std::move(request));
}

Result<Value::Dictionary> Client::codeSigningInfo(const std::string& identifier) {
  Message request;
  request.set("Identifier", identifier);
  const auto reply = call(kGetCodeSigningInfo, std::move(request));
  if (!reply) return std::unexpected(reply.error());
  const Value::Dictionary* info = reply->dictionary(kInfo);
  if (info == nullptr) return missing(kInfo);
  return *info;
}

Result<void> Client::invalidateCodeSigningInfo() {
  return callForNothing(kInvalidateCodeSigningInfo, Message());
}

}  // namespace tessary
