#include "Daemon/TSYUserIdentity.h"

#include <gtest/gtest.h>

#include "Daemon/TSYUserIdentityCache.h"
#include "Tests/Daemon/TestPlatform.h"

namespace {

using platform::PersonaKind;
using platform::Value;

TSYUserIdentityRef makeIdentity(uid_t uid, TSYPersonaType type,
                                std::optional<std::string> uniqueString = std::nullopt) {
  return TSYUserIdentity::initWithUID(uid, uid, TSYURL("/home"), std::move(uniqueString), type, 7);
}

TEST(TSYUserIdentity, roleAccountsOwnNothing) {
  const TestPlatform platform;
  EXPECT_EQ(makeIdentity(0, TSYPersonaType::personal), nullptr);
  EXPECT_EQ(makeIdentity(500, TSYPersonaType::enterprise, "E"), nullptr);
  EXPECT_NE(makeIdentity(501, TSYPersonaType::personal), nullptr);
}

TEST(TSYUserIdentity, theIdentifierAloneDecidesEquality) {
  const TestPlatform platform;
  const auto personal = makeIdentity(501, TSYPersonaType::personal, "P");
  const auto unspecific = makeIdentity(501, TSYPersonaType::unspecific);
  const auto first = makeIdentity(501, TSYPersonaType::enterprise, "E1");
  const auto second = makeIdentity(501, TSYPersonaType::enterprise, "E2");
  EXPECT_EQ(personal->identifier(), "501");
  EXPECT_EQ(first->identifier(), "E1");
  EXPECT_TRUE(personal->isEqualToUserIdentity(*unspecific));
  EXPECT_FALSE(first->isEqualToUserIdentity(*second));
  EXPECT_FALSE(first->isEqualToUserIdentity(*personal));
  EXPECT_TRUE(first->isEqualToUserIdentity(*makeIdentity(502, TSYPersonaType::enterprise, "E1")));
}

TEST(TSYUserIdentity, ownersOfContainersDependOnTheClass) {
  const TestPlatform platform;
  const auto identity = TSYUserIdentity::initWithUID(501, 20, TSYURL("/home"), std::nullopt,
                                                     TSYPersonaType::personal, 501);
  for (const uint64_t class_ : {1U, 3U, 5U, 8U}) {
    EXPECT_EQ(identity->posixUIDForContainerClass(class_), 33U) << class_;
    EXPECT_EQ(identity->posixGIDForContainerClass(class_), 33U) << class_;
    EXPECT_FALSE(TSYUserIdentity::isUserIdentityRequiredForContainerClass(class_)) << class_;
  }
  for (const uint64_t class_ : {12U, 13U}) {
    EXPECT_EQ(identity->posixUIDForContainerClass(class_), 0U) << class_;
    EXPECT_FALSE(TSYUserIdentity::isUserIdentityRequiredForContainerClass(class_)) << class_;
  }
  for (const uint64_t class_ : {0U, 2U, 4U, 6U, 7U, 9U, 10U, 11U, 14U, 65U, 0xffffffffU}) {
    EXPECT_EQ(identity->posixUIDForContainerClass(class_), 501U) << class_;
    EXPECT_EQ(identity->posixGIDForContainerClass(class_), 20U) << class_;
    EXPECT_TRUE(TSYUserIdentity::isUserIdentityRequiredForContainerClass(class_)) << class_;
  }
}

FakePersonas::List personalAndEnterprise() {
  return {makePersona(PersonaKind::personal, 100, "P"),
          makePersona(PersonaKind::enterprise, 200, "E")};
}

Value makePlist(Value version, Value uid, Value gid,
                const std::map<std::string, Value>& more = {}) {
  Value::Dictionary plist = {{"version", std::move(version)}};
  plist.emplace("posixUID", std::move(uid));
  plist.emplace("posixGID", std::move(gid));
  for (const auto& [key, value] : more) plist.insert_or_assign(key, value);
  return plist;
}

TEST(TSYUserIdentity, plistsNameIdentitiesOfTheCache) {
  const TestPlatform platform(personalAndEnterprise());
  TSYUserIdentityCache cache;
  const struct {
    const char* name;
    Value plist;
    const char* identifier;
    uid_t uid;
    TSYPersonaType type = TSYPersonaType::personal;
  } cases[] = {
      {"personal", makePlist("2", 501, 501, {{"type", 0}}), "501", 501},
      {"unspecific comes back as personal", makePlist("2", 501, 501, {{"type", 2}}), "501", 501},
      {"other user", makePlist("2", 502, 502, {{"type", 0}}), "502", 502},
      {"role account", makePlist("2", 33, 33, {{"type", 0}}), "501", 501},
      {"enterprise", makePlist("2", 501, 501, {{"type", 1}, {"personaUniqueString", "E"}}), "E",
       501, TSYPersonaType::enterprise},
      {"enterprise of another user",
       makePlist("2", 502, 502, {{"type", 1}, {"personaUniqueString", "E"}}), "E", 502,
       TSYPersonaType::enterprise},
      {"said to be enterprise, but is not",
       makePlist("2", 501, 501, {{"type", 1}, {"personaUniqueString", "P"}}), "501", 501},
      {"enterprise without a string", makePlist("2", 501, 501, {{"type", 1}}), "501", 501},
      {"version 1", makePlist("1", 501, 501), "501", 501},
      {"version 1 with a persona", makePlist("1", 501, 501, {{"personaIdentifier", "E"}}), "E", 501,
       TSYPersonaType::enterprise},
      {"version 1, persona unknown", makePlist("1", 502, 502, {{"personaIdentifier", "gone"}}),
       "502", 502},
  };
  for (const auto& test : cases) {
    const auto identity = TSYUserIdentity::userIdentityWithPlist(test.plist, cache);
    ASSERT_TRUE(identity.has_value()) << test.name;
    EXPECT_EQ((*identity)->identifier(), test.identifier) << test.name;
    EXPECT_EQ((*identity)->posixUID(), test.uid) << test.name;
    EXPECT_EQ((*identity)->posixGID(), test.uid) << test.name;
    EXPECT_EQ((*identity)->personaType(), test.type) << test.name;
    // What is written names the same identity again.
    const auto again = TSYUserIdentity::userIdentityWithPlist((*identity)->plist(), cache);
    ASSERT_TRUE(again.has_value()) << test.name;
    EXPECT_TRUE((*again)->isEqualToUserIdentity(**identity)) << test.name;
  }
}

TEST(TSYUserIdentity, whatIsNoIdentityIsRefused) {
  const TestPlatform platform(personalAndEnterprise());
  TSYUserIdentityCache cache;
  const struct {
    const char* name;
    Value plist;
    uint64_t code;
  } cases[] = {
      {"no dictionary", "2", 1},
      {"version is a number", makePlist(2, 501, 501, {{"type", 0}}), 1},
      {"version 3", makePlist("3", 501, 501, {{"type", 0}}), 1},
      {"enterprise persona gone",
       makePlist("2", 501, 501, {{"type", 1}, {"personaUniqueString", "gone"}}), 1},
      {"uid is text", makePlist("2", "501", 501, {{"type", 0}}), 75},
      {"gid missing", Value::Dictionary{{"version", "1"}, {"posixUID", 501}}, 75},
      {"uid beyond 32 bits", makePlist("1", int64_t{0x1000001f5}, 501), 75},
      {"negative uid", makePlist("1", -2, 501), 75},
      {"the uid that means none", makePlist("1", 0xffffffffU, 501), 75},
      {"type missing", makePlist("2", 501, 501), 75},
      {"type too large", makePlist("2", 501, 501, {{"type", 3}}), 75},
  };
  for (const auto& test : cases) {
    const auto identity = TSYUserIdentity::userIdentityWithPlist(test.plist, cache);
    ASSERT_FALSE(identity.has_value()) << test.name;
    EXPECT_EQ(identity.error().code(), test.code) << test.name;
  }
  const auto malformed =
      TSYUserIdentity::userIdentityWithPlist(makePlist("2", 501, 501, {{"type", 3}}), cache);
  EXPECT_TRUE(malformed.error().localizedDescription()->starts_with(
      "Invalid user identity plist data. Expected persona type for type, got 3. Data: "));
}

}  // namespace
