// Allocations that fail. The sanitizers bring an operator new of their own.
#include "Tests/Integration/SanitizedBuild.h"

#ifndef TESSARY_SANITIZED

#include <gtest/gtest.h>

#include <cstdlib>
#include <new>

#include "Daemon/TSYClientConnection.h"
#include "Daemon/TSYCodeSigningMapping.h"
#include "Daemon/TSYException.h"
#include "Tests/Daemon/ContainerDevice.h"

namespace {

// How many allocations of this thread still succeed before one fails; negative for all of them.
thread_local int allocationsBeforeFailure = -1;

}  // namespace

// GCC does not see that this pair belongs together.
#pragma GCC diagnostic ignored "-Wmismatched-new-delete"

void* operator new(size_t size) {
  if (allocationsBeforeFailure >= 0 && allocationsBeforeFailure-- == 0) throw std::bad_alloc();
  if (void* memory = std::malloc(size)) return memory;
  throw std::bad_alloc();
}
void* operator new(size_t size, const std::nothrow_t& /*tag*/) noexcept {
  return std::malloc(size);
}
void operator delete(void* memory) noexcept {
  std::free(memory);
}
void operator delete(void* memory, size_t /*size*/) noexcept {
  std::free(memory);
}

namespace {

TSYUserIdentityRef mobile() {
  return TSYUserIdentitySharedCache::sharedInstance().userIdentityForPersonalPersona();
}

// Whichever allocation fails, the request fails and not the process, and the next one finds nothing
// half-built in its way.
TEST(TSYClientConnection, anExceptionBecomesAnErrorWhereverItIsThrown) {
  // At the level of the daemon: lines for debugging are also written where locks are released.
  const ContainerDevice device(std::nullopt, {}, TSYLogLevelNotice);
  const auto client = TSYClientConnection::privilegedClientConnectionWithUserIdentity(mobile());
  const auto make = [&](const std::string& identifier, int allocations) {
    const std::optional<TSYContainerIdentity> identity = containerOf(mobile(), identifier, 2);
    allocationsBeforeFailure = allocations;
    auto made = client->createOrLookupContainerWithContainerIdentity(
        identity, /*createIfNecessary=*/true, /*transient=*/false, /*useLocking=*/true);
    allocationsBeforeFailure = -1;
    return made;
  };
  ASSERT_TRUE(make("com.example.first", -1).has_value());  // shared instances and class directories
  int failures = 0;
  for (int allocations = 0;; allocations += 7) {
    const std::string identifier = "com.example.app" + std::to_string(allocations);
    const auto made = make(identifier, allocations);
    if (made) break;
    if (made.error().is(TSYErrorException)) ++failures;
    ASSERT_TRUE(make(identifier, -1).has_value()) << allocations;
  }
  EXPECT_GT(failures, 10);
  const std::string live = "/private/var/mobile/Containers/Data/Application/";
  for (const std::string& name : device.namesIn(live)) {
    EXPECT_EQ(device.namesIn(live + name).size(), 5U) << "half-built: " << name;
  }
}

// A registration that an allocation ends is done or not, and nothing is stuck: no transaction, no
// statement, no queue.
TEST(TSYCodeSigningMapping, anExceptionLeavesTheDatabaseUsable) {
  const ContainerDevice device(std::nullopt, {}, TSYLogLevelError);
  TSYCodeSigningMapping& mapping = TSYCodeSigningMapping::sharedInstance();
  TSYCommandQueue queue;
  const auto infoOf = [](int version) {
    return std::make_shared<const platform::Value::Dictionary>(
        platform::Value::Dictionary{{"version", version}});
  };
  const auto put = [&](const TSYCodeSigningMapping::Info& info, int allocations) {
    const std::string identifier = "com.example.app";
    const platform::Value::Dictionary options{{"com.veltra.Tessary.ParentBundleID", "parent"}};
    allocationsBeforeFailure = allocations;
    auto done = TSYCatchingExceptions([&]() -> TSYResult<uint64_t> {
      return mapping.processCodeSigningInfo(info, identifier, options, queue);
    });
    allocationsBeforeFailure = -1;
    return done ? *done : done.error().code();
  };
  ASSERT_EQ(mapping.processCodeSigningInfo(infoOf(0), "parent", {}, queue), 1U);
  ASSERT_EQ(put(infoOf(-1), -1), 1U);
  int failures = 0;
  for (int allocations = 0;; ++allocations) {
    const auto info = infoOf(allocations);
    const uint64_t code = put(info, allocations);
    if (code == TSYErrorException) ++failures;
    const auto entry = mapping.codeSigningEntryForIdentifier("com.example.app");
    ASSERT_TRUE(entry.has_value()) << allocations;
    if (code == TSYErrorSuccess && *(*entry)->codeSigningInfo == *info) break;
    ASSERT_EQ(put(infoOf(-1), -1), 1U) << allocations;
    ASSERT_EQ(mapping.parentIdentifierForChildIdentifier("com.example.app"), "parent");
  }
  EXPECT_GT(failures, 10);
}

}  // namespace

#endif
