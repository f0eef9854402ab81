#include <gtest/gtest.h>
#include <sys/stat.h>

#include <filesystem>

#include "Daemon/TSYFileManager.h"
#include "Daemon/TSYGlobalConfiguration.h"
#include "Daemon/TSYPerUserConfiguration.h"
#include "Daemon/TSYUserIdentityCache.h"
#include "Tests/Daemon/ContainerDevice.h"

namespace {

TEST(TSYConfiguration, hasNoDirectoryForUnknownClassesAndUsersWithoutAHome) {
  const ContainerDevice device;
  TSYGlobalConfiguration& global = TSYGlobalConfiguration::sharedInstance();
  const TSYUserIdentityRef mobile = TSYUserIdentityCache::defaultUserIdentity();
  for (const TSYContainerClass class_ : {0UL, 14UL, 1UL << 33, ~0UL}) {
    EXPECT_FALSE(global.globalContainerBaseURLWithContentClass(class_, /*transient=*/false));
    EXPECT_FALSE(global.containerDirectoryURLForUserIdentity(mobile, class_, /*transient=*/false));
  }
  EXPECT_FALSE(global.containerDirectoryURLForUserIdentity(nullptr, 2, /*transient=*/false));
  EXPECT_FALSE(global.stagingDirectoryURLForUserIdentity(nullptr, 7));
  TSYPerUserConfiguration homeless(TSYUserIdentity::initWithUID(
      600, 600, std::nullopt, std::nullopt, TSYPersonaType::personal, 600));
  EXPECT_FALSE(homeless.userBaseDirectory());
  EXPECT_FALSE(homeless.containerDirectoryURLForContentClass(2, /*transient=*/true));
  EXPECT_FALSE(homeless.systemContainerBackupDirectory());
}

}  // namespace
