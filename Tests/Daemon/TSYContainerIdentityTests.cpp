#include "Daemon/TSYContainerIdentity.h"

#include <gtest/gtest.h>

#include "Tests/Daemon/ContainerDevice.h"

namespace {

using platform::Value;

TEST(TSYContainerIdentity, invalidPartsAreRefusedInOrder) {
  const ContainerDevice device;
  const TSYUserIdentityRef user = TSYUserIdentityCache::defaultUserIdentity();
  const Value text("com.example.app");
  const Value number(7);
  const struct {
    TSYUserIdentityRef user;
    const Value* identifier;
    TSYContainerClass class_;
    uint64_t code;
    const char* text;
  } cases[] = {{nullptr, nullptr, 0, 11, "Invalid object: no user identity"},
               {user, nullptr, 0, 18, "Invalid object: missing identifier"},
               {user, &number, 0, 11, "Invalid object: identifier = [7]"},
               {user, &text, 14, 11, "Invalid object: container class = 14"}};
  for (const auto& [owner, identifier, class_, code, message] : cases) {
    expectFailure(
        TSYContainerIdentity::containerIdentityWithUserIdentity(owner, identifier, class_), code,
        message);
  }
  expectFailure(TSYConcreteContainerIdentity::containerIdentityWithUUID(std::nullopt, user, "a", 2),
                11, "");
  EXPECT_TRUE(TSYContainerIdentity::containerIdentityWithIdentifier("", 1).has_value());
  for (const TSYContainerClass class_ : {0U, 2U, 7U, 14U}) {
    SCOPED_TRACE("only global classes go without a user identity");
    expectFailure(TSYContainerIdentity::containerIdentityWithIdentifier("a", class_), 11, "");
  }
}

}  // namespace
