#include "Daemon/TSYContainerIdentity.h"

#include <gtest/gtest.h>

#include "Daemon/TSYUserIdentityCache.h"
#include "Tests/Daemon/TestPlatform.h"

namespace {

using platform::UUID;
using platform::Value;

TSYUserIdentityRef makeUser(TSYPersonaType type, const char* uniqueString) {
  return TSYUserIdentity::initWithUID(501, 501, TSYURL("/home"), uniqueString, type, 501);
}

TEST(TSYContainerIdentity, invalidPartsAreRefusedInOrder) {
  const TestPlatform platform;
  const TSYUserIdentityRef user = makeUser(TSYPersonaType::personal, "P");
  const Value text("com.example.app");
  const Value empty("");
  const Value number(7);
  const struct {
    TSYUserIdentityRef user;
    const Value* identifier;
    TSYContainerClass class_;
    uint64_t code;
    const char* text;
  } cases[] = {
      {nullptr, nullptr, 0, 11, "Invalid object: no user identity"},
      {user, nullptr, 0, 18, "Invalid object: missing identifier"},
      {user, &number, 0, 11, "Invalid object: identifier = [7]"},
      {user, &text, 0, 11, "Invalid object: container class = 0"},
      {user, &text, 14, 11, "Invalid object: container class = 14"},
      {user, &text, 1, 1, ""},
      {user, &empty, 13, 1, ""},
  };
  for (const auto& test : cases) {
    const auto identity = TSYContainerIdentity::containerIdentityWithUserIdentity(
        test.user, test.identifier, test.class_);
    ASSERT_EQ(identity.has_value(), test.code == 1) << test.class_;
    if (identity) continue;
    EXPECT_EQ(identity.error().code(), test.code);
    EXPECT_EQ(identity.error().localizedDescription(), test.text);
  }
  const auto noUUID = TSYConcreteContainerIdentity::containerIdentityWithUUID(std::nullopt, user,
                                                                              "com.example.app", 2);
  ASSERT_FALSE(noUUID.has_value());
  EXPECT_EQ(noUUID.error().code(), 11U);
}

TEST(TSYContainerIdentity, onlyGlobalClassesGoWithoutAUserIdentity) {
  const TestPlatform platform;
  const auto bundle = TSYContainerIdentity::containerIdentityWithIdentifier("com.example.app", 1);
  ASSERT_TRUE(bundle.has_value());
  EXPECT_EQ(bundle->userIdentity(), TSYUserIdentityCache::defaultUserIdentity());
  for (const TSYContainerClass class_ : {0U, 2U, 7U, 14U}) {
    const auto identity =
        TSYContainerIdentity::containerIdentityWithIdentifier("com.example.app", class_);
    ASSERT_FALSE(identity.has_value()) << class_;
    EXPECT_EQ(identity.error().code(), 11U) << class_;
  }
}

TEST(TSYContainerIdentity, equalityFollowsUserIdentifierClassAndUUID) {
  const TestPlatform platform;
  const auto make = [](TSYUserIdentityRef user, const char* identifier, TSYContainerClass class_) {
    return *TSYContainerIdentity::containerIdentityWithUserIdentity(std::move(user), identifier,
                                                                    class_);
  };
  const auto personal = makeUser(TSYPersonaType::personal, "P");
  const auto plain = make(personal, "com.example.app", 2);
  const auto unspecific = make(makeUser(TSYPersonaType::unspecific, "P"), "com.example.app", 2);
  EXPECT_TRUE(plain.isEqualToContainerIdentity(unspecific));
  EXPECT_EQ(plain.hash(), unspecific.hash());
  EXPECT_FALSE(plain.isEqualToContainerIdentity(
      make(makeUser(TSYPersonaType::enterprise, "E"), "com.example.app", 2)));
  EXPECT_FALSE(plain.isEqualToContainerIdentity(make(personal, "com.example.App", 2)));
  EXPECT_FALSE(plain.isEqualToContainerIdentity(make(personal, "com.example.app", 4)));

  const auto concrete = [&](const UUID& uuid) {
    return *TSYConcreteContainerIdentity::containerIdentityWithUUID(uuid, personal,
                                                                    "com.example.app", 2);
  };
  const UUID first = UUID::random();
  EXPECT_TRUE(plain.isEqualToContainerIdentity(concrete(first)));
  EXPECT_TRUE(concrete(first).isEqualToConcreteContainerIdentity(concrete(first)));
  EXPECT_FALSE(concrete(first).isEqualToConcreteContainerIdentity(concrete(UUID::random())));
  EXPECT_EQ(concrete(first).hash(), plain.hash() ^ std::hash<UUID>{}(first));
}

}  // namespace
