#include <gtest/gtest.h>
#include <sys/stat.h>

#include <filesystem>

#include "Daemon/TSYFileManager.h"
#include "Daemon/TSYGlobalConfiguration.h"
#include "Daemon/TSYPerUserConfiguration.h"
#include "Daemon/TSYUserIdentityCache.h"
#include "Tests/Daemon/TestPlatform.h"

namespace {

constexpr char kHome[] = "/private/var/mobile";
constexpr char kCaches[] = "/private/var/root/Library/Caches/com.veltra.tessaryd";

struct ExpectedDirectory {
  std::optional<TSYURL> url;
  std::string path;
  uid_t owner = 0;
  int protectionClass = 0;
};

// The directory stands where it should, 0755 whatever the umask, with its owner and class.
void expectMade(const TestPlatform& platform, const ExpectedDirectory& expected) {
  ASSERT_TRUE(expected.url.has_value()) << expected.path;
  EXPECT_EQ(expected.url->path(), platform.path(expected.path));
  struct stat status{};
  ASSERT_EQ(::stat(expected.url->path().c_str(), &status), 0) << expected.path;
  EXPECT_EQ(status.st_mode & 07777U, 0755U) << expected.path;
  if (::geteuid() == 0) {
    EXPECT_EQ(status.st_uid, expected.owner) << expected.path;
    EXPECT_EQ(status.st_gid, expected.owner) << expected.path;
  }
  const auto class_ =
      TSYFileManager::defaultManager().dataProtectionClassOfItemAtURL(*expected.url);
  EXPECT_EQ(class_.value_or(-1), expected.protectionClass) << expected.path;
}

TEST(TSYGlobalConfiguration, makesItsDirectoriesOnEveryCall) {
  const TestPlatform platform;
  ::umask(077);
  TSYGlobalConfiguration& configuration = TSYGlobalConfiguration::sharedInstance();
  const std::string caches = kCaches;
  const std::string library = "/private/var/root/Library/Tessary";
  const std::string shared = "/private/var/containers";
  // Twice: the second round finds what the first one made gone.
  for (int round = 0; round < 2; ++round) {
    expectMade(platform, {configuration.cachesDirectory(), caches, 0, 4});
    expectMade(platform, {configuration.libraryDirectory(), library, 0, 4});
    expectMade(platform,
               {configuration.logDirectory(), "/private/var/root/Library/Logs/Tessary", 0, 4});
    expectMade(platform, {configuration.sharedContainersDirectory(), shared});
    expectMade(platform, {configuration.transientDirectory(), caches + "/Temp"});
    expectMade(platform, {configuration.stagingDirectory(), caches + "/Staging"});
    expectMade(platform, {configuration.deathrowDirectory(), caches + "/Dead"});
    expectMade(platform, {configuration.replaceDirectory(), library + "/Replace"});
    expectMade(platform, {configuration.pendingUpdatesDirectory(), library + "/PendingUpdates"});
    expectMade(platform, {configuration.bundleDirectory(), shared + "/Bundle"});
    expectMade(platform, {configuration.transientBundleDirectory(), shared + "/Temp", 33});
    std::filesystem::remove_all(platform.path("/private/var/root/Library"));
    std::filesystem::remove_all(platform.path(shared));
  }
  EXPECT_EQ(configuration.temporaryDirectory().path(), platform.path("/tmp"));
}

TEST(TSYGlobalConfiguration, classDirectoriesFollowTheClass) {
  const TestPlatform platform;
  TSYGlobalConfiguration& configuration = TSYGlobalConfiguration::sharedInstance();
  const TSYUserIdentityRef mobile = TSYUserIdentityCache::defaultUserIdentity();
  const struct {
    TSYContainerClass class_;
    bool transient;
    std::string path;
    uid_t owner;
    std::string staging;
  } cases[] = {
      {1, false, "/private/var/containers/Bundle/Application", 33, kCaches},
      {8, true, "/private/var/containers/Temp/Bundle/Framework", 33, kCaches},
      {12, false, "/private/var/containers/Data/System", 0, kCaches},
      {12, true, std::string(kCaches) + "/Temp/Data/System", 0, kCaches},
      {13, false, "/private/var/containers/Shared/SystemGroup", 0, kCaches},
      {2, false, std::string(kHome) + "/Containers/Data/Application", 501, ""},
      {2, true, std::string(kHome) + "/Containers/Temp/Data/Application", 501, ""},
      {7, false, std::string(kHome) + "/Containers/Shared/AppGroup", 501, ""},
      {11, false, std::string(kHome) + "/Containers/Data/TempDir", 501, ""},
  };
  for (const auto& test : cases) {
    const auto url =
        configuration.containerDirectoryURLForUserIdentity(mobile, test.class_, test.transient);
    expectMade(platform, {url, test.path, test.owner});
    const std::string base =
        test.staging.empty() ? std::string(kHome) + "/Containers" : test.staging;
    const auto staging = configuration.stagingDirectoryURLForUserIdentity(mobile, test.class_);
    EXPECT_EQ(staging->path(), platform.path(base + "/Staging")) << test.class_;
    const auto global =
        configuration.globalContainerBaseURLWithContentClass(test.class_, test.transient);
    EXPECT_EQ(global.has_value(), test.owner != 501) << test.class_;
  }
  for (const TSYContainerClass class_ : {0UL, 14UL, 1UL << 33, ~0UL}) {
    EXPECT_FALSE(configuration.globalContainerBaseURLWithContentClass(class_, /*transient=*/false));
    EXPECT_FALSE(configuration.containerDirectoryURLForUserIdentity(mobile, class_,
                                                                    /*transient=*/false));
  }
}

TEST(TSYGlobalConfiguration, globalClassesNeedNoUserIdentity) {
  const TestPlatform platform(std::nullopt, {{"/etc/passwd", "root:x:0:0::/private/var/root:\n"}});
  TSYGlobalConfiguration& configuration = TSYGlobalConfiguration::sharedInstance();
  EXPECT_EQ(configuration.currentMobileUserId(), 0U);
  EXPECT_TRUE(configuration.containerDirectoryURLForUserIdentity(nullptr, 12, /*transient=*/false));
  EXPECT_FALSE(configuration.containerDirectoryURLForUserIdentity(nullptr, 2, /*transient=*/false));
  EXPECT_TRUE(configuration.stagingDirectoryURLForUserIdentity(nullptr, 1));
  EXPECT_FALSE(configuration.stagingDirectoryURLForUserIdentity(nullptr, 7));
}

TEST(TSYGlobalConfiguration, markersAndLegacyDirectoriesAreSeenWhenTheyAreThere) {
  const TestPlatform platform;
  TSYGlobalConfiguration& configuration = TSYGlobalConfiguration::sharedInstance();
  EXPECT_FALSE(configuration.legacyTransientBundleDirectory());
  EXPECT_FALSE(configuration.migrationFileExistsWithName("marker"));
  const std::string legacy = "/private/var/hatcheryd/Library/Caches/com.veltra.tessaryd";
  platform.write(legacy + "/item", "");
  platform.write("/private/var/root/Library/Tessary/marker", "");
  EXPECT_EQ(configuration.legacyTransientBundleDirectory().value_or(TSYURL()).path(),
            platform.path(legacy));
  EXPECT_TRUE(configuration.migrationFileExistsWithName("marker"));
}

TEST(TSYPerUserConfiguration, directoriesBelongToTheUser) {
  const TestPlatform platform;
  TSYGlobalConfiguration& global = TSYGlobalConfiguration::sharedInstance();
  const auto alice =
      TSYUserIdentity::initWithUID(502, 502, TSYURL(platform.path("/private/var/alice")),
                                   std::nullopt, TSYPersonaType::personal, 502);
  const auto equal = TSYUserIdentity::initWithUID(502, 1, TSYURL("/elsewhere"), std::nullopt,
                                                  TSYPersonaType::unspecific, 1);
  TSYPerUserConfiguration& configuration = global.getPerUserConfigurationForUserIdentity(alice);
  EXPECT_EQ(&configuration, &global.getPerUserConfigurationForUserIdentity(equal));
  const std::string home = "/private/var/alice";
  expectMade(platform, {configuration.userBaseDirectory(), home + "/Containers", 502});
  expectMade(platform, {configuration.transientDirectory(), home + "/Containers/Temp", 502});
  expectMade(platform, {configuration.stagingDirectory(), home + "/Containers/Staging", 502});
  expectMade(platform, {configuration.libraryDirectory(), home + "/Library/Tessary", 502});
  EXPECT_EQ(configuration.systemGroupContainerBackupDirectory()->path(),
            platform.path(home + "/Library/Backup/SystemContainers/Shared"));
  EXPECT_FALSE(std::filesystem::exists(platform.path(home + "/Library/Backup")));
}

TEST(TSYPerUserConfiguration, withoutAHomeThereIsNothing) {
  const TestPlatform platform;
  const auto homeless = TSYUserIdentity::initWithUID(600, 600, std::nullopt, std::nullopt,
                                                     TSYPersonaType::personal, 600);
  TSYPerUserConfiguration configuration(homeless);
  EXPECT_FALSE(configuration.existsUserBaseDirectory());
  EXPECT_FALSE(configuration.userBaseDirectory());
  EXPECT_FALSE(configuration.containerDirectoryURLForContentClass(2, /*transient=*/true));
  EXPECT_FALSE(configuration.systemContainerBackupDirectory());
  EXPECT_FALSE(configuration.oldLoggingPath());
}

TEST(TSYPerUserConfiguration, aUserCannotLeadTheDaemonOutOfHisHome) {
  const TestPlatform platform;
  std::filesystem::create_directories(platform.path("/etc/victim"));
  std::filesystem::create_symlink(platform.path("/etc/victim"),
                                  platform.path(std::string(kHome) + "/Containers"));
  TSYPerUserConfiguration configuration(TSYUserIdentityCache::defaultUserIdentity());
  // The URL comes back all the same, but nothing was made behind the link.
  EXPECT_TRUE(configuration.containerDirectoryURLForContentClass(2, /*transient=*/false));
  EXPECT_TRUE(std::filesystem::is_empty(platform.path("/etc/victim")));
  struct stat status{};
  ASSERT_EQ(::stat(platform.path("/etc/victim").c_str(), &status), 0);
  EXPECT_NE(status.st_uid, 501U);
}

}  // namespace
