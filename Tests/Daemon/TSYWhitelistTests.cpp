#include "Daemon/TSYWhitelist.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "Tests/Daemon/TestPlatform.h"

namespace {

constexpr char kCoverage[] = "systemgroup.com.veltra.coverage";

TEST(TSYWhitelist, wellKnownContainersDependOnTheClass) {
  const TestPlatform platform;
  const TSYWhitelist& list = TSYWhitelist::sharedWhitelist();
  const struct {
    std::string identifier;
    TSYContainerClass class_;
    bool wellKnown;
  } cases[] = {{"com.veltra.exampled", 12, true},
               {"com.veltra.exampled", 13, false},
               {"com.veltra.exampled", 2, false},
               {"com.veltra.Exampled", 12, false},
               {"systemgroup.com.veltra.palette", 13, true},
               {"systemgroup.com.veltra.palette", 12, false},
               {"systemgroup.com.veltra.palette", 7, false},
               {kCoverage, 13, false},
               {"", 12, false},
               {"com.veltra.exampled", 14, false}};
  for (const auto& test : cases) {
    EXPECT_EQ(list.containerIdIsWellknown(test.identifier, test.class_), test.wellKnown)
        << test.identifier << test.class_;
    EXPECT_EQ(list.wellknownContainerForId(test.identifier, test.class_),
              test.wellKnown ? std::optional(test.identifier) : std::nullopt);
  }
  EXPECT_TRUE(list.systemContainerIdIsWellknown("com.veltra.ledgerd"));
  EXPECT_FALSE(list.systemGroupContainerIdIsWellknown("com.veltra.ledgerd"));
  EXPECT_EQ(list.wellknownSystemContainers().size(), 2U);
  EXPECT_EQ(list.wellknownSystemGroupContainers().size(), 8U);
}

TEST(TSYWhitelist, internalBuildsHaveACoverageGroup) {
  const TestPlatform platform(std::nullopt, {{"/etc/os-release", "VARIANT_ID=internal\n"}});
  const TSYWhitelist& list = TSYWhitelist::sharedWhitelist();
  EXPECT_TRUE(list.containerIdIsWellknown(kCoverage, 13));
  EXPECT_EQ(list.wellknownSystemGroupContainers().size(), 9U);
}

TEST(TSYWhitelist, lookupPermission) {
  const TSYWhitelist list({{"com.system", "renamed"}}, {}, {{10, {"com.open"}}, {0, {"com.zero"}}},
                          {{"com.any", std::nullopt},
                           {"com.some", {{{2, {{"com.app", "com.other"}}}, {7, std::nullopt}}}}});
  EXPECT_EQ(list.wellknownSystemContainerForId("com.system"), "renamed");
  EXPECT_EQ(list.wellknownSystemContainerForId("renamed"), std::nullopt);
  const struct {
    std::string asker;
    TSYContainerClass class_;
    std::string container;
    bool allowed;
  } cases[] = {{"com.nobody", 10, "com.open", true}, {"", 10, "com.open", true},
               {"com.nobody", 9, "com.open", false}, {"com.nobody", 10, "com.opened", false},
               {"com.nobody", 0, "com.zero", true},  {"com.any", 1, "com.app", true},
               {"com.any", 13, "x", true},           {"com.any", 14, "x", false},
               {"com.any", ~0ULL, "x", false},       {"com.some", 2, "com.app", true},
               {"com.some", 2, "com.other", true},   {"com.some", 2, "com.third", false},
               {"com.some", 4, "com.app", false},    {"com.some", 7, "anything", true},
               {"com.Some", 2, "com.app", false}};
  for (const auto& test : cases) {
    EXPECT_EQ(
        list.isLookupWhitelistedFromCodeSignIdentifier(test.asker, test.class_, test.container),
        test.allowed)
        << test.asker << " " << test.class_ << " " << test.container;
  }
}

}  // namespace
