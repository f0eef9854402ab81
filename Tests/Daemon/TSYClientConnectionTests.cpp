#include "Daemon/TSYClientConnection.h"

#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <linux/fs.h>
#include <sys/ioctl.h>

#include <atomic>
#include <future>
#include <thread>

#include "Daemon/TSYContainerCache.h"
#include "Daemon/TSYFileManager.h"
#include "Tests/Daemon/ContainerDevice.h"

namespace {

using platform::Platform;
using platform::UUID;
using platform::Value;
using testing::IsEmpty;

const std::string kHome = "/private/var/mobile/Containers";
const std::string kCaches = "/private/var/root/Library/Caches/com.veltra.tessaryd";
const std::string kShared = "/private/var/containers";
const std::string kDeathRow = kCaches + "/Dead";

TSYUserIdentityRef mobile() {
  return TSYUserIdentitySharedCache::sharedInstance().userIdentityForPersonalPersona();
}

TSYResult<TSYMetadataRef> make(const std::string& identifier, TSYContainerClass class_,
                               bool transient = false, bool createIfNecessary = true) {
  return TSYClientConnection::privilegedClientConnectionWithUserIdentity(mobile())
      ->createOrLookupContainerWithContainerIdentity(containerOf(mobile(), identifier, class_),
                                                     createIfNecessary, transient,
                                                     /*useLocking=*/true);
}

TEST(TSYClientConnection, whoMayLookUpWhat) {
  const ContainerDevice device;
  const Value::Dictionary listed{{"appData", Value::Array{7, "com.b", Value::Array{"com.c"}}},
                                 {"systemData", Value::Array{"com.a", "com.b"}},
                                 {"appGroup", "group"},
                                 {"", Value::Array{"com.b"}}};
  const struct {
    std::string client;  // "-" for a process without an identity
    std::string identifier;
    TSYContainerClass class_;
    std::string rights;  // other identifiers, groups, unrestricted, the list above
    std::string refused;
  } cases[] = {
      {"com.a", "com.a", 2, "", ""},
      {"com.a", "com.b", 2, "",
       "com.a not entitled to retrieve container class 2 with "
       "identifier com.b"},
      {"com.a", "com.b", 2, "o", ""},
      {"com.a", "com.b", 2, "u", ""},
      {"com.a", "group", 7, "g", ""},
      {"com.a", "group", 13, "g", ""},
      {"com.a", "com.b", 2, "g", "class 2"},
      {"com.a", "com.b", 12, "g", "class 12"},
      {"com.a", "com.b", 2, "l", ""},
      {"com.a", "com.b", 4, "l", "class 4"},
      {"com.a", "com.b", 1, "l", "class 1 "},
      {"com.a", "com.c", 2, "l", "class 2"},
      {"com.a", "7", 2, "l", "class 2"},
      {"com.a", "group", 7, "l", "class 7"},
      {"com.veltra.hatcheryd", "com.b", 2, "", ""},
      {"com.veltra.hatcheryd", "com.b", 12, "", ""},
      {"com.a", "com.veltra.beacond", 10, "", ""},
      {"com.a", "com.veltra.exampled", 12, "", "class 12"},
      {"com.a", "com.a", 12, "", "com.a not entitled for system container with identifier com.a"},
      {"com.a", "com.a", 12, "g", "com.a not entitled for system container"},
      {"com.a", "com.a", 12, "o", ""},
      {"com.a", "com.a", 12, "u", ""},
      {"com.a", "com.b", 12, "l", ""},
      {"com.a", "com.a", 13, "", ""},
      {"-", "", 2, "", " not entitled to retrieve container class 2 with identifier "},
      {"-", "", 12, "", "class 12"}};
  for (const auto& test : cases) {
    const auto has = [&](char right) { return test.rights.find(right) != std::string::npos; };
    TSYClientConnection connection(test.client == "-" ? nullptr : clientWith(test.client, mobile()),
                                   /*entitled=*/false, has('o'), has('u'),
                                   has('l') ? TSYClientConnection::Lookup(listed) : std::nullopt,
                                   std::nullopt, std::make_shared<TSYCommandQueue>());
    EXPECT_FALSE(connection.allowGroupIdLookup());
    connection.setAllowGroupIdLookup(has('g'));
    const auto found = connection.createOrLookupContainerWithContainerIdentity(
        containerOf(mobile(), test.identifier, test.class_), /*createIfNecessary=*/false,
        /*transient=*/false, /*useLocking=*/true);
    SCOPED_TRACE(
        fmt::format("{} {} {} {}", test.client, test.identifier, test.class_, test.rights));
    expectFailure(found, test.refused.empty() ? 21 : 55,
                  test.refused.empty()
                      ? "Container with identifier: \"" + test.identifier + "\" Not Found"
                      : test.refused);
    EXPECT_FALSE(connection.isEntitledForLookupWithClass(14, "com.b"));
  }
  EXPECT_EQ(device.countInLog("Not Found"), 0U) << "a miss is no line in the log";
  expectFailure(
      TSYClientConnection::sharedClientConnection().createOrLookupContainerWithContainerIdentity(
          std::nullopt, true, false, true),
      38, "Cannot lookup a nil container identity.");
}

struct stat statusOf(const std::string& path) {
  struct stat status{};
  EXPECT_EQ(::lstat(path.c_str(), &status), 0) << path;
  return status;
}

TEST(TSYClientConnection, aContainerOfEachClassIsBuiltWhole) {
  if (::geteuid() != 0) GTEST_SKIP() << "owners need root's rights";
  const ContainerDevice device;
  constexpr uid_t kNobody = 4294967294U;
  const struct {
    TSYContainerClass class_;
    std::string directory;
    uid_t owner;
    mode_t mode;
    uid_t contentOwner;
    mode_t contentMode;
  } cases[] = {{1, kShared + "/Bundle/Application", 33, 0755, 33, 0755},
               {2, kHome + "/Data/Application", 501, 0755, 501, 0755},
               {3, kShared + "/Bundle/ModulinePlugin", 33, 0755, 33, 0755},
               {4, kHome + "/Data/ModulinePlugin", 501, 0755, 501, 0755},
               {5, kShared + "/Bundle/VPNPlugin", 33, 0755, 33, 0755},
               {6, kHome + "/Data/VPNPlugin", 501, 0755, 501, 0755},
               {7, kHome + "/Shared/AppGroup", 501, 0755, 501, 0755},
               {8, kShared + "/Bundle/Framework", 33, 0755, 33, 0755},
               {9, kHome + "/Data/RelayService", 501, 0755, 501, 0755},
               {10, kHome + "/Data/InternalDaemon", 501, 0755, 501, 0755},
               {11, kHome + "/Data/TempDir", 501, 0755, 501, 0755},
               // The group bits are the ACL's mask: access is granted by the list alone.
               {12, kShared + "/Data/System", 0, 0775, kNobody, 0070},
               {13, kShared + "/Shared/SystemGroup", 0, 0775, kNobody, 0070}};
  for (const auto& test : cases) {
    SCOPED_TRACE(test.class_);
    const auto made = make("com.app", test.class_);
    ASSERT_TRUE(made.has_value()) << made.error().description();
    const TSYMetadata& container = **made;
    EXPECT_FALSE(container.existed());
    const std::string name(container.url().lastPathComponent());
    EXPECT_EQ(container.url().path(), device.path(test.directory + "/" + name));
    ASSERT_TRUE(UUID::parse(name).has_value());
    EXPECT_NE(UUID::parse(name), container.uuid());
    const auto top = statusOf(container.url().path());
    EXPECT_EQ(top.st_uid, test.owner);
    EXPECT_EQ(top.st_mode & 07777U, test.mode);

    const auto names = Platform::current().containerLayout.subdirectoriesOfClass(test.class_);
    size_t items = 1;  // the metadata file
    for (const std::string& relative : *names) {
      const TSYURL url = container.url().appending(relative);
      const auto status = statusOf(url.path());
      EXPECT_TRUE(S_ISDIR(status.st_mode));
      EXPECT_EQ(status.st_uid, test.contentOwner) << relative;
      EXPECT_EQ(status.st_gid, test.contentOwner) << relative;
      EXPECT_EQ(status.st_mode & 07777U, test.contentMode) << relative;
      EXPECT_EQ(TSYFileManager::defaultManager().dataProtectionClassOfItemAtURL(url).value_or(-1),
                0);
      ++items;
    }
    const std::filesystem::recursive_directory_iterator tree(container.url().path());
    EXPECT_EQ(static_cast<size_t>(std::distance(begin(tree), end(tree))), items);
    const auto onDisk = TSYMetadata::readAndValidateMetadataAtUrl(container.url(), mobile(), true);
    ASSERT_TRUE(onDisk.has_value());
    EXPECT_EQ(onDisk->uuid(), container.uuid());
    EXPECT_EQ(statusOf(container.metadataFileURL().path()).st_uid, 0U);

    const auto again = make("com.app", test.class_);
    ASSERT_TRUE(again.has_value());
    EXPECT_TRUE((*again)->existed());
    EXPECT_EQ((*again)->uuid(), container.uuid());
    EXPECT_EQ(device.mappings().size(), TSYIsBundleClass(test.class_) ? 0U : 1U);
    EXPECT_TRUE(TSYContainerCache::sharedInstance()
                    .removeContainerForUserIdentity(mobile(), test.class_, "com.app", false)
                    .has_value());
  }
  EXPECT_THAT(device.namesIn(kCaches + "/Staging"), IsEmpty());
  EXPECT_THAT(device.namesIn(kHome + "/Staging"), IsEmpty());
  EXPECT_THAT(device.namesIn(kDeathRow), IsEmpty());
}

TEST(TSYClientConnection, wellKnownContainersLiveUnderTheirNames) {
  const ContainerDevice device;
  const auto pathOf = [&](const std::string& identifier, TSYContainerClass class_) {
    return make(identifier, class_).value()->url().path();
  };
  EXPECT_EQ(pathOf("com.veltra.exampled", 12),
            device.path(kShared + "/Data/System/com.veltra.exampled"));
  EXPECT_EQ(pathOf("systemgroup.com.veltra.palette", 13),
            device.path(kShared + "/Shared/SystemGroup/systemgroup.com.veltra.palette"));
  for (const auto& [identifier, class_] :
       {std::pair("com.veltra.exampled", 13U), {"systemgroup.com.veltra.palette", 12U}}) {
    const std::string path = pathOf(identifier, class_);
    EXPECT_TRUE(UUID::parse(path.substr(path.rfind('/') + 1)).has_value()) << path;
  }
}

TEST(TSYClientConnection, aTransientContainerIsReplacedByTheNext) {
  const ContainerDevice device;
  expectFailure(make("com.app", 2, /*transient=*/true, /*createIfNecessary=*/false), 21, "");
  const auto first = make("com.app", 2, /*transient=*/true);
  ASSERT_TRUE(first.has_value());
  EXPECT_TRUE((*first)->transient());
  EXPECT_TRUE((*first)->url().path().starts_with(device.path(kHome + "/Temp/Data/Application/")));
  expectFailure(make("com.app", 2, /*transient=*/true, /*createIfNecessary=*/false), 21, "");
  expectFailure(make("com.app", 2, /*transient=*/false, /*createIfNecessary=*/false), 21, "");
  const auto second = make("com.app", 2, /*transient=*/true);
  ASSERT_TRUE(second.has_value());
  EXPECT_FALSE((*second)->existed());
  EXPECT_NE((*second)->uuid(), (*first)->uuid());
  EXPECT_EQ(device.namesIn(kHome + "/Temp/Data/Application").size(), 1U);
  ContainerDevice::waitForDeathRow();
  EXPECT_THAT(device.namesIn(kDeathRow), IsEmpty());
  EXPECT_THAT(device.mappings(), IsEmpty());
  EXPECT_FALSE((*make("com.app", 2))->existed()) << "the live one is another";
}

TEST(TSYClientConnection, aFailureLeavesNothingAtTheLivePathAndNothingInStaging) {
  const std::string layout =
      "<plist><dict><key>7</key><array><string>Library</string><string>" + std::string(300, 'x') +
      "</string></array><key>9</key><array><string>../out</string></array></dict></plist>";
  const ContainerDevice device(std::nullopt, {{"/etc/tessary/container-layout.plist", layout}});
  const std::string application = kHome + "/Data/Application";
  const std::string staging = kHome + "/Staging";
  const auto expectClean = [&](TSYContainerClass class_) {
    EXPECT_THAT(device.namesIn(staging), IsEmpty()) << class_;
    expectFailure(make("com.app", class_, false, /*createIfNecessary=*/false), 21, "");
    ContainerDevice::waitForDeathRow();
    EXPECT_THAT(device.namesIn(kDeathRow), IsEmpty()) << class_;
  };
  expectFailure(make("com.app", 7), 6, "Failed to create sub-dir for com.app at ");
  EXPECT_THAT(device.namesIn(kHome + "/Shared/AppGroup"), IsEmpty());
  expectClean(7);
  expectFailure(make("com.app", 9), 22, "Failed to get subdirectory names for 9 : 22");
  expectClean(9);

  // The class directory turns into a file after it was scanned: the move fails.
  expectFailure(make("com.app", 2, false, /*createIfNecessary=*/false), 21, "");
  std::filesystem::remove(device.path(application));
  device.write(application, "in the way");
  expectFailure(make("com.app", 2), 8, "Failed to move staging dir: " + device.path(staging));
  expectClean(2);
  // The same without a death row: what is in staging stays, and the code says so.
  device.write(kDeathRow + ".away", "");
  std::filesystem::remove(device.path(kDeathRow));
  std::filesystem::rename(device.path(kDeathRow + ".away"), device.path(kDeathRow));
  expectFailure(make("com.app", 2), 9, "Failed to remove staging dir: " + device.path(staging));
  EXPECT_EQ(device.namesIn(staging).size(), 1U);
  // A class directory that was never scanned fails before anything is built.
  device.write(kHome + "/Data/TempDir", "in the way");
  expectFailure(make("com.app", 11), 43, "Failed to rebuild");

  // The user puts a link in the place of his staging directory.
  std::filesystem::remove_all(device.path(staging));
  std::filesystem::create_directory_symlink(device.path("/etc"), device.path(staging));
  const auto before = device.namesIn("/etc");
  expectFailure(make("com.app", 10), 7, "Failed to create staging dir at ");
  EXPECT_EQ(device.namesIn("/etc"), before);
}

TEST(TSYClientConnection, requestsAtTheSameTimeCreateOneContainer) {
  const ContainerDevice device;
  std::atomic<int> made = 0;
  std::vector<std::future<std::string>> paths;
  for (int thread = 0; thread < 8; ++thread) {
    paths.push_back(std::async(std::launch::async, [&made, thread] {
      EXPECT_TRUE(make("com.own" + std::to_string(thread), 2).has_value());
      EXPECT_TRUE(make("com.transient", 4, /*transient=*/true).has_value());
      const auto container = make("com.app", 2);
      if (!container) return container.error().description();
      if (!(*container)->existed()) ++made;
      return (*container)->url().path();
    }));
  }
  const std::string path = paths.front().get();
  for (size_t i = 1; i < paths.size(); ++i) EXPECT_EQ(paths[i].get(), path);
  EXPECT_EQ(made, 1);
  EXPECT_EQ(device.namesIn(kHome + "/Data/Application").size(), 9U);
  EXPECT_EQ(device.namesIn(kHome + "/Temp/Data/ModulinePlugin").size(), 1U);
}

TEST(TSYClientConnection, listsTheContainersOfItsUser) {
  const ContainerDevice device(workPersonas());
  TSYUserIdentityCache& users = TSYUserIdentitySharedCache::sharedInstance();
  const auto countFor = [&](const TSYUserIdentityRef& user, TSYContainerClass class_) {
    const auto all =
        TSYClientConnection::privilegedClientConnectionWithUserIdentity(user)->containersWithClass(
            class_, /*transient=*/false);
    return all ? static_cast<int>(all->size()) : -static_cast<int>(all.error().code());
  };
  const TSYUserIdentityRef work = users.userIdentityForCurrentUserWithPersonaUniqueString("E1");
  ASSERT_TRUE(make("com.app", 2).has_value());
  EXPECT_EQ(countFor(mobile(), 2), 1);
  EXPECT_EQ(countFor(work, 2), 0);
  EXPECT_EQ(countFor(users.unspecificUserIdentity(), 2), 1);
  EXPECT_EQ(countFor(mobile(), 0), -11);
  EXPECT_EQ(countFor(mobile(), 14), -11);
}

uint64_t emptyDeathRow() {
  std::promise<uint64_t> code;
  TSYClientConnection::sharedClientConnection().deleteContainersOnDeathRowWithCompletion(
      [&](uint64_t result) { code.set_value(result); });
  return code.get_future().get();
}

TEST(TSYClientConnection, whatGoesToDeathRowKeepsItsNameAndIsEmptiedLater) {
  const ContainerDevice device;
  TSYClientConnection& connection = TSYClientConnection::sharedClientConnection();
  device.write("/one/same/inside/file", "1");
  device.write("/two/same", "2");
  device.write("/victim/file", "3");
  std::filesystem::create_symlink(device.path("/victim"), device.path("/three"));
  for (const char* item : {"/one/same", "/two/same", "/three", "/missing"}) {
    EXPECT_TRUE(
        connection
            ._moveItemAtURLToDeathRow(TSYURL(device.path(item)), /*startDeletionThread=*/false)
            .has_value())
        << item;
    EXPECT_FALSE(std::filesystem::exists(device.path(item)));
  }
  EXPECT_EQ(device.namesIn(kDeathRow).size(), 4U) << "each in a directory of its own";
  EXPECT_EQ(emptyDeathRow(), 1U);
  EXPECT_THAT(device.namesIn(kDeathRow), IsEmpty());
  EXPECT_EQ(device.read("/victim/file"), "3");
  std::filesystem::remove_all(device.path(kCaches));
  EXPECT_EQ(emptyDeathRow(), 1U);

  std::filesystem::remove_all(device.path(kCaches));
  device.write(kDeathRow, "in the way");
  EXPECT_EQ(emptyDeathRow(), 28U);
  expectFailure(connection._moveItemAtURLToDeathRow(TSYURL(device.path("/victim")),
                                                    /*startDeletionThread=*/false),
                41, "Failed to create unique directory at: " + device.path("/victim"));
}

TEST(TSYClientConnection, whatCannotBeRemovedIsMovedOutOfDeathRow) {
  const ContainerDevice device;
  device.write(kDeathRow + "/item/stubborn/file", "");
  device.write(kDeathRow + "/other/file", "");
  const auto setFlags = [](const std::string& directory, int flags) {
    const platform::FileDescriptor descriptor(::open(directory.c_str(), O_RDONLY | O_DIRECTORY));
    return ::ioctl(descriptor.get(), FS_IOC_SETFLAGS, &flags) == 0;
  };
  // Nothing can be taken out of a directory that can only be added to.
  if (!setFlags(device.path(kDeathRow + "/item/stubborn"), FS_APPEND_FL)) {
    GTEST_SKIP() << "the file system has no such flag";
  }
  EXPECT_EQ(emptyDeathRow(), 17U) << "there is no /tmp";
  EXPECT_THAT(device.namesIn(kDeathRow), testing::ElementsAre("item"));
  EXPECT_EQ(device.countInLog("Failed to destroy item at: " + device.path(kDeathRow + "/item")),
            1U);
  std::filesystem::create_directory(device.path("/tmp"));
  EXPECT_EQ(emptyDeathRow(), 1U);
  EXPECT_THAT(device.namesIn(kDeathRow), IsEmpty());
  EXPECT_EQ(device.namesIn("/tmp/item/stubborn").size(), 1U);
  setFlags(device.path("/tmp/item/stubborn"), 0);
}

}  // namespace
