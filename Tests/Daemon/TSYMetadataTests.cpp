#include "Daemon/TSYMetadata.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <cmath>

#include "Daemon/TSYFileManager.h"
#include "Tests/Daemon/ContainerDevice.h"

namespace {

using platform::UUID;
using platform::Value;

constexpr char kContainer[] = "/private/var/mobile/Containers/Data/Application/somewhere";
constexpr char kUUID[] = "0F8FAD5B-D9CB-469F-A165-70867728950E";
const std::string kFile = std::string(kContainer) + "/" + kTSYMetadataFileName;

TSYUserIdentityCache& users() {
  return TSYUserIdentitySharedCache::sharedInstance();
}

Value::Dictionary validMetadata() {
  return {{"TSYMetadataIdentifier", "com.example.app"},
          {"TSYMetadataUUID", kUUID},
          {"TSYMetadataContentClass", 2},
          {"TSYMetadataUserIdentity", users().userIdentityForPersonalPersona()->plist()}};
}

TSYResult<TSYMetadata> readFor(const ContainerDevice& device, const TSYUserIdentityRef& expected,
                               bool checkClassPath = false,
                               const std::string& container = kContainer) {
  return TSYMetadata::readAndValidateMetadataAtUrl(TSYURL(device.path(container)), expected,
                                                   checkClassPath);
}

TSYResult<TSYMetadata> read(const ContainerDevice& device) {
  return readFor(device, users().userIdentityForPersonalPersona());
}

// What Python prints for a script that gets a file of the device as argument.
std::string python(const std::string& script, const std::string& path) {
  const std::string command = "python3 -c 'import plistlib, sys\n" + script + "' '" + path + "'";
  FILE* pipe = ::popen(command.c_str(), "r");
  std::string output(65536, '\0');
  output.resize(std::fread(output.data(), 1, output.size(), pipe));
  EXPECT_EQ(::pclose(pipe), 0);
  return output;
}

TEST(TSYMetadata, whatIsWrittenIsRead) {
  const ContainerDevice device(workPersonas());
  const TSYUserIdentityRef work = users().userIdentityForCurrentUserWithPersonaUniqueString("E1");
  const auto info = std::make_shared<const Value::Dictionary>(
      Value::Dictionary{{"list", Value::Array{1, true, 2.5, "ä\n"}}, {"", Value::Data{0, 255}}});
  const struct {
    TSYUserIdentityRef user;
    TSYContainerClass class_;
    TSYMetadata::Info info;
    std::optional<std::string> assets;
  } cases[] = {{users().userIdentityForPersonalPersona(), 7, info, "assets"},
               {work, 2, nullptr, std::nullopt},
               {work, 4, std::make_shared<const Value::Dictionary>(), ""},
               {TSYUserIdentityCache::defaultUserIdentity(), 12, info, std::nullopt},
               {TSYUserIdentityCache::defaultUserIdentity(), 1, nullptr, std::nullopt}};
  device.write(std::string(kContainer) + "/x", "");
  for (const auto& test : cases) {
    const auto identity = concreteContainerOf(test.user, "com.example.ä", test.class_);
    const TSYMetadata written(identity, test.info, TSYURL(device.path(kContainer)), test.assets);
    ASSERT_TRUE(written.writeMetadataToDisk().has_value());
    const auto metadata = readFor(device, test.user);
    ASSERT_TRUE(metadata.has_value()) << metadata.error().description();
    EXPECT_TRUE(metadata->containerIdentity().isEqualToConcreteContainerIdentity(identity));
    EXPECT_EQ(metadata->url().path(), device.path(kContainer));
    EXPECT_EQ(metadata->userManagedAssetsDirName(), test.assets);
    ASSERT_EQ(metadata->info() != nullptr, test.info != nullptr);
    EXPECT_TRUE(!test.info || *metadata->info() == *test.info);

    EXPECT_EQ(TSYFileManager::defaultManager()
                  .dataProtectionClassOfItemAtURL(TSYURL(device.path(kFile)))
                  .value_or(-1),
              4);
  }
  // Temporary files went into place.
  for (const char* staging :
       {"/private/var/mobile/Containers/Staging", "/private/var/E1/Containers/Staging",
        "/private/var/root/Library/Caches/com.veltra.tessaryd/Staging"}) {
    EXPECT_TRUE(std::filesystem::exists(device.path(staging))) << staging;
    EXPECT_THAT(device.namesIn(staging), testing::IsEmpty());
  }
}

TEST(TSYMetadata, aFailedWriteLeavesTheOldFile) {
  const ContainerDevice device(workPersonas());
  device.write(std::string(kContainer) + "/x", "");
  device.write(kFile, "old");
  const std::string staging = device.path("/private/var/mobile/Containers/Staging");
  device.write("/private/var/mobile/Containers/Staging", "in the way");
  const auto identity = concreteContainerOf(users().userIdentityForPersonalPersona(), "a", 2);
  const TSYMetadata metadata(identity, nullptr, TSYURL(device.path(kContainer)), std::nullopt);
  const std::string temporary = staging + "/temp_metadata-" + identity.uuid().string() + ".plist";
  expectFailure(
      metadata.writeMetadataToDisk(), 34,
      fmt::format("Failed to write metadata dictionary to URL {} : POSIX:{}", temporary, ENOTDIR));
  EXPECT_EQ(device.read(kFile), "old");
  std::filesystem::remove(staging);
  const std::string nowhere = device.path("/nowhere/file");
  expectFailure(
      metadata.writeMetadataToFileURL(TSYURL(nowhere)), 34,
      fmt::format("Failed to move metadata from staging: {} to final: {}", temporary, nowhere));
}

TEST(TSYMetadata, checksRunInOrderAndEachNamesItsFault) {
  const ContainerDevice device(workPersonas());
  // One file with every fault; each step reports the first that is left and then mends it.
  Value::Dictionary file{{"TSYMetadataInfo", Value::Array{}},
                         {"TSYMetadataUserManagedAssetsDirName", 1},
                         {"TSYMetadataUserIdentity", "nobody"},
                         {"TSYMetadataPersona", 502}};
  const TSYUserIdentityRef work = users().userIdentityForCurrentUserWithPersonaUniqueString("E1");
  const struct {
    std::string message;
    std::string key;
    std::optional<Value> next;
  } steps[] = {
      {"Invalid metadata Identifier: (null) at ", "TSYMetadataIdentifier", 7},
      {"Invalid metadata Identifier: 7 at ", "TSYMetadataIdentifier", "com.example.app"},
      {"Invalid metadata UUID String: (null) at ", "TSYMetadataUUID", Value::Data{1}},
      {"Invalid metadata UUID String: ", "TSYMetadataUUID", "0F8FAD5B"},
      {"Invalid metadata UUID: 0F8FAD5B at ", "TSYMetadataUUID", kUUID},
      {"Invalid metadata Class: (null) at ", "TSYMetadataContentClass", "2"},
      {"Invalid metadata Class: 2 at ", "TSYMetadataContentClass", 0},
      {"Invalid metadata Content Class: 0 at ", "TSYMetadataContentClass", 14},
      {"Invalid metadata Content Class: 14 at ", "TSYMetadataContentClass", -1},
      {"Invalid metadata Content Class: -1 at ", "TSYMetadataContentClass", std::nan("")},
      {"Invalid metadata Content Class: 0 at ", "TSYMetadataContentClass", 2},
      {"Incorrect UserId: 502, expecting: 501 for com.example.app at ", "TSYMetadataPersona",
       "501"},
      {"Incorrect UserId: 501, expecting: 501 for com.example.app at ", "TSYMetadataPersona", 501},
      {"Invalid metadata User Identity: nobody for com.example.app at ", "TSYMetadataUserIdentity",
       work->plist()},
      {"Incorrect User Identity: ", "TSYMetadataUserIdentity",
       validMetadata()["TSYMetadataUserIdentity"]},
      {"Invalid metadata Info: () at ", "TSYMetadataInfo", std::nullopt},
      {"Invalid metadata User Managed Dir Name String: 1 at ",
       "TSYMetadataUserManagedAssetsDirName", std::nullopt}};
  for (const auto& step : steps) {
    device.writePropertyList(kFile, file);
    const auto metadata = read(device);
    expectFailure(metadata, 29, step.message);
    expectFailure(metadata, 29, device.path(kFile));
    EXPECT_NE(device.countInLog(step.message), 0U) << step.message;
    file.erase(step.key);
    if (step.next) file.emplace(step.key, *step.next);
  }
  device.writePropertyList(kFile, file);
  EXPECT_TRUE(read(device).has_value());
}

TEST(TSYMetadata, ownersOfOldAndOfGlobalFiles) {
  const ContainerDevice device(workPersonas());
  const TSYUserIdentityRef personal = users().userIdentityForPersonalPersona();
  const TSYUserIdentityRef alice = users().userIdentityForPersonalPersonaWithUID(502, 502);
  const TSYUserIdentityRef work = users().userIdentityForCurrentUserWithPersonaUniqueString("E1");
  const auto text = [](const TSYUserIdentityRef& user) {
    return fmt::format("{}/{} {}", user->posixUID(), user->posixGID(), user->identifier());
  };
  const auto ownerOf = [&](const Value& persona, const Value& user, int class_,
                           const TSYUserIdentityRef& expected) -> std::string {
    Value::Dictionary file = validMetadata();
    file["TSYMetadataContentClass"] = class_;
    file.erase("TSYMetadataUserIdentity");
    if (!user.isNull()) file["TSYMetadataUserIdentity"] = user;
    if (!persona.isNull()) file["TSYMetadataPersona"] = persona;
    device.writePropertyList(kFile, file);
    const auto metadata = readFor(device, expected);
    return metadata ? text(metadata->userIdentity()) : "none";
  };
  EXPECT_EQ(ownerOf(501, nullptr, 2, personal), text(personal));
  EXPECT_EQ(ownerOf(nullptr, nullptr, 2, personal), text(personal));
  EXPECT_EQ(ownerOf(502, nullptr, 2, alice), text(alice));
  EXPECT_EQ(ownerOf(501, nullptr, 2, alice), "none");
  EXPECT_EQ(ownerOf(501, work->plist(), 11, work), text(work));
  // Without a user identity in it nothing is compared with the expected one but the uid.
  EXPECT_EQ(ownerOf(501, nullptr, 2, work), text(personal));
  for (const int global : {1, 8, 12, 13}) {
    EXPECT_EQ(ownerOf(7, "nobody", global, work), text(TSYUserIdentityCache::defaultUserIdentity()))
        << global;
  }
  EXPECT_EQ(ownerOf(nullptr, nullptr, 1, nullptr),
            text(TSYUserIdentityCache::defaultUserIdentity()));
  EXPECT_EQ(ownerOf(501, nullptr, 2, nullptr), "none");
}

TEST(TSYMetadata, theClassPathProvesTheClass) {
  const ContainerDevice device(workPersonas());
  const struct {
    std::string container;
    bool valid;
  } cases[] = {{"/any/base/Data/Application/x", true},
               {"/Data/Application/x", true},
               {"/private/var/mobile/Containers/Temp/Data/Application/x", true},
               {"/any/Data/ModulinePlugin/x", false},
               {"/any/Data/Application/deeper/x", false},
               {"/any/xData/Application/x", false},
               {"/any/data/Application/x", false}};
  for (const auto& test : cases) {
    device.writePropertyList(test.container + "/" + kTSYMetadataFileName, validMetadata());
    const TSYUserIdentityRef user = users().userIdentityForPersonalPersona();
    const auto checked = readFor(device, user, /*checkClassPath=*/true, test.container);
    EXPECT_EQ(checked.has_value(), test.valid) << test.container;
    if (!checked) expectFailure(checked, 29, "Invalid metadata-URLs should match: ");
    EXPECT_TRUE(readFor(device, user, /*checkClassPath=*/false, test.container).has_value());
  }
}

TEST(TSYMetadata, whatIsNoFileOfADictionaryIsNotRead) {
  const ContainerDevice device(workPersonas());
  device.writePropertyList("/valid", validMetadata());
  const std::string path = device.path(kFile);
  const std::function<void()> obstacles[] = {
      [] {},
      [&] { device.write(kFile, ""); },
      [&] { device.write(kFile, "bplist00 no more"); },
      [&] { device.writePropertyList(kFile, Value::Array{validMetadata()}); },
      [&] { std::filesystem::create_symlink(device.path("/valid"), path); },
      [&] { std::filesystem::create_directory(path); },
      [&] { ASSERT_EQ(::mkfifo(path.c_str(), 0666), 0); },
      [&] {
        device.writePropertyList(kFile, validMetadata());
        std::filesystem::resize_file(path, platform::PropertyListLimits::kBytes + 1);
      },
      [&] {  // the container itself is a link
        std::filesystem::rename(device.path(kContainer), device.path("/elsewhere"));
        device.writePropertyList(std::string("/elsewhere/") + kTSYMetadataFileName,
                                 validMetadata());
        std::filesystem::create_symlink(device.path("/elsewhere"), device.path(kContainer));
      }};
  std::filesystem::create_directories(device.path(kContainer));
  for (const auto& obstruct : obstacles) {
    std::filesystem::remove_all(path);
    obstruct();
    expectFailure(read(device), 12, "Failed to read metadata at URL " + path);
  }
}

TEST(TSYMetadata, agreesWithPython) {
  const ContainerDevice device;
  std::filesystem::create_directories(device.path(kContainer));
  for (const char* format : {"FMT_XML", "FMT_BINARY"}) {
    python(
        fmt::format("plistlib.dump({{\"TSYMetadataIdentifier\": \"com.example.ä&\",\n"
                    "  \"TSYMetadataUUID\": \"{}\", \"TSYMetadataContentClass\": 2,\n"
                    "  \"TSYMetadataPersona\": 501, \"TSYMetadataInfo\": {{\"k\": [1, b\"x\"]}}}},"
                    " open(sys.argv[1], \"wb\"), fmt=plistlib.{})",
                    kUUID, format),
        device.path(kFile));
    const auto metadata = read(device);
    ASSERT_TRUE(metadata.has_value()) << metadata.error().description();
    EXPECT_EQ(metadata->identifier(), "com.example.ä&");
    EXPECT_EQ(metadata->uuid(), UUID::parse(kUUID));
    EXPECT_EQ(metadata->info()->at("k"), Value(Value::Array{1, Value::Data{'x'}}));
    ASSERT_TRUE(metadata->writeMetadataToDisk().has_value());
    EXPECT_EQ(python("d = plistlib.load(open(sys.argv[1], \"rb\"))\n"
                     "u = d.pop(\"TSYMetadataUserIdentity\")\nprint(sorted(d.items()), type(u))",
                     device.path(kFile)),
              fmt::format("[('TSYMetadataContentClass', 2), ('TSYMetadataIdentifier', "
                          "'com.example.ä&'), ('TSYMetadataInfo', {{'k': [1, b'x']}}), "
                          "('TSYMetadataUUID', '{}'), ('TSYMetadataVersion', '2')] "
                          "<class 'dict'>\n",
                          kUUID));
  }
}

}  // namespace
