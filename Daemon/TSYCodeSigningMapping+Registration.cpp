// Registering code-signing information, and forgetting it.
#include <algorithm>

#include "Daemon/TSYCodeSigningKeys.h"
#include "Daemon/TSYCodeSigningMapping.h"
#include "Daemon/TSYException.h"
#include "Daemon/TSYGlobalConfiguration.h"
#include "Daemon/TSYLocks.h"
#include "Daemon/TSYLog.h"
#include "Daemon/TSYPropertyList.h"

using platform::LogLevel;
using platform::Value;

namespace {

TSYCodeSigningEntry entryFor(const TSYCodeSigningMapping::Info& info,
                             const Value::Dictionary& options) {
  const Value* containerClass = TSYValueUnder(options, kTSYOptionDataContainerClass);
  const uint64_t number =
      containerClass == nullptr ? 0 : containerClass->unsignedOfNumber().value_or(0);
  // The database keeps 32 bits; an entry that is compared with one read from it has no more.
  TSYCodeSigningEntry entry(info, static_cast<uint32_t>(number));
  entry.registeredByCaller = TSYFlagUnder(options, kTSYOptionRegisteredByCaller);
  entry.placeholder = TSYFlagUnder(options, kTSYOptionPlaceholder);
  entry.advanceCopy = TSYFlagUnder(options, kTSYOptionAdvanceCopy);
  return entry;
}

// The installer's word counts for more than a caller's, and what is known need not be written.
bool isNewsOfCaller(const TSYCodeSigningEntryRef& entry, const Value::Dictionary* recorded,
                    const Value::Dictionary& entitlements) {
  if (!entry) return true;
  return entry->registeredByCaller && (recorded == nullptr || *recorded != entitlements);
}

}  // namespace

uint64_t TSYCodeSigningMapping::processCodeSigningInfo(const Info& info,
                                                       const std::optional<std::string>& identifier,
                                                       const Value::Dictionary& options,
                                                       TSYCommandQueue& commandQueue) {
  if (!identifier) return TSYErrorMissingIdentifier;
  // Takes over what is with the bundle container: it is what the new information is compared with.
  (void)entitlementsForIdentifier(*identifier);
  return onQueue([&] {
    queue_.assertCurrent();
    return _onQueue_processCodeSigningInfo(info, *identifier, options, commandQueue);
  });
}

uint64_t TSYCodeSigningMapping::processCallerRegisteredEntitlements(
    const Value::Dictionary& entitlements, const std::string& identifier,
    TSYCommandQueue& commandQueue) {
  const auto isNews = [&](const TSYCodeSigningEntryRef& entry) {
    return isNewsOfCaller(entry, _entitlementsFromCodeSigningEntry(entry).get(), entitlements);
  };
  const auto entry = codeSigningEntryForIdentifier(identifier);
  if (!entry) return entry.error().clientCode();
  if (!isNews(*entry)) return TSYErrorSuccess;
  if (*entry) {
    TSYLogWrite(TSYLogLevelNotice, "{} has changed entitlements. Re-registering.", identifier);
  }
  const auto info = std::make_shared<const Value::Dictionary>(
      Value::Dictionary{{kTSYCodeSigningEntitlements, entitlements}});
  if (!TSYHasPropertyListForm(*info)) return TSYErrorInvalidArgument;
  const TSYAllIdentifiersLock lock(TSYLockMode::writing, /*useLocking=*/true);
  (void)entitlementsForIdentifier(identifier);
  return onQueue([&]() -> uint64_t {
    queue_.assertCurrent();
    // The installer, or another request of the caller, may have been quicker.
    const auto now = _onQueue_codeSigningEntryForIdentifier(identifier);
    if (!now) return now.error().clientCode();
    if (!isNews(*now)) return TSYErrorSuccess;
    return _onQueue_processCodeSigningInfo(info, identifier, {{kTSYOptionRegisteredByCaller, true}},
                                           commandQueue);
  });
}

void TSYCodeSigningMapping::removeCodeSigningDictionariesForIdentifierAndItsChildren(
    const std::string& identifier, TSYCommandQueue& commandQueue) {
  auto all =
      childBundleIdentifiersForParentIdentifier(identifier).value_or(std::vector<std::string>());
  all.push_back(identifier);
  for (const std::string& each : all) {
    const uint64_t code =
        processCodeSigningInfo(/*info=*/nullptr, each, /*options=*/{}, commandQueue);
    if (code == TSYErrorSuccess) continue;
    TSYLogWrite(TSYLogLevelError, "Failed to clear entitlements for {} : {}", each, code);
  }
}

uint64_t TSYCodeSigningMapping::_onQueue_processCodeSigningInfo(const Info& info,
                                                                const std::string& identifier,
                                                                const Value::Dictionary& options,
                                                                TSYCommandQueue& commandQueue) {
  const bool isInternalImage = TSYGlobalConfiguration::sharedInstance().isInternalImage();
  const auto registered = TSYCatchingExceptionsUnlessInternal(isInternalImage, [&] {
    queue_.assertCurrent();
    return _onQueue_register(info, identifier, options, commandQueue);
  });
  return registered ? uint64_t{TSYErrorSuccess} : registered.error().clientCode();
}

TSYResult<void> TSYCodeSigningMapping::_onQueue_register(const Info& info,
                                                         const std::string& identifier,
                                                         const Value::Dictionary& options,
                                                         TSYCommandQueue& commandQueue) {
  const auto current = _onQueue_codeSigningEntryForIdentifier(identifier);
  if (!current) return TSYFailure(current.error());
  Writes writes;
  const Value* parent = TSYValueUnder(options, kTSYOptionParentBundleID);
  if (parent != nullptr && parent->asString() != nullptr) {
    auto staged = _onQueue_stageChild(*parent->asString(), identifier, writes);
    if (!staged) return staged;
  }
  const TSYCodeSigningEntry entry = entryFor(info, options);
  if (!*current || **current != entry) {
    // Before the write: the counts still hold what the entry names now.
    _onQueue_reconcile(identifier, _entitlementsFromCodeSigningEntry(*current),
                       _entitlementsFromInfo(info), commandQueue);
    writes.emplace_back(identifier, info ? entry : TSYCodeSigningEntry());
  }
  _onQueue_setCodeSigningDictionaryValues(writes);
  return {};
}

// An application that is not registered yet is not written: its own registration makes the tie.
TSYResult<void> TSYCodeSigningMapping::_onQueue_stageChild(const std::string& parent,
                                                           const std::string& identifier,
                                                           Writes& writes) {
  const auto current = _onQueue_codeSigningEntryForIdentifier(parent);
  if (!current) return TSYFailure(current.error());
  TSYCodeSigningEntry entry = *current ? **current : TSYCodeSigningEntry();
  auto children = std::move(entry.childBundleIdentifiers).value_or(std::vector<std::string>());
  if (std::ranges::find(children, identifier) != children.end()) return {};
  children.push_back(identifier);
  TSYLogWrite(TSYLogLevelDebug, "Staging Child Bundles: {} for parent ID: {} by appending: {}",
              TSYListText(children), parent, identifier);
  entry.childBundleIdentifiers = std::move(children);
  writes.emplace_back(parent, std::move(entry));
  return {};
}

void TSYCodeSigningMapping::_onQueue_setCodeSigningDictionaryValues(const Writes& writes) {
  for (const auto& [identifier, entry] : writes) _onQueue_write(identifier, entry);
}

void TSYCodeSigningMapping::_onQueue_write(const std::string& identifier,
                                           const TSYCodeSigningEntry& entry) {
  const auto current = _onQueue_codeSigningEntryForIdentifier(identifier);
  if (!current) return;
  // An entry without information is none.
  if (!entry.codeSigningInfo) {
    if (!*current) return;
    const auto deleted = _onQueue_change(
        [&](TSYSQLiteDB& db) { return db.deleteCodeSigningEntryWithIdentifier(identifier); });
    if (deleted) {
      TSYSystemLogWrite(TSYChannel::codesignmapping, LogLevel::standard,
                        "Deleted Code Signing Mapping for ID: {}", identifier);
    } else {
      TSYLogWrite(TSYLogLevelError, "Failed to delete code signing info from DB for {} : {}",
                  identifier, deleted.error());
    }
    return;
  }
  if (*current && **current == entry) return;
  const auto added =
      _onQueue_change([&](TSYSQLiteDB& db) { return db.addCodeSigningEntry(entry, identifier); });
  if (added) {
    TSYSystemLogWrite(TSYChannel::codesignmapping, LogLevel::standard,
                      "Set Code Signing Mapping for ID: {} : {}", identifier, entry.description());
  } else {
    TSYLogWrite(TSYLogLevelError, "Failed to write code signing info to DB for {} : {}", identifier,
                added.error());
  }
}
