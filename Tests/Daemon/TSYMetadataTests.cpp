#include "Daemon/TSYMetadata.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <cmath>

#include "Tests/Daemon/ContainerDevice.h"

namespace {

using platform::Value;

constexpr char kUUID[] = "0F8FAD5B-D9CB-469F-A165-70867728950E";

class Metadata : public testing::Test {
 protected:
  TSYUserIdentityRef user(const char* uniqueString) const {
    return TSYUserIdentitySharedCache::sharedInstance()
        .userIdentityForCurrentUserWithPersonaUniqueString(uniqueString);
  }
  Value::Dictionary valid() const {
    return {{"TSYMetadataIdentifier", "com.example.app"},
            {"TSYMetadataUUID", kUUID},
            {"TSYMetadataContentClass", 2},
            {"TSYMetadataUserIdentity", user("P")->plist()}};
  }
  TSYResult<TSYMetadata> read(const TSYUserIdentityRef& expected, bool checkClassPath = false) {
    return TSYMetadata::readAndValidateMetadataAtUrl(TSYURL(device_.path(container_)), expected,
                                                     checkClassPath);
  }
  void put(const Value& content) { device_.writePropertyList(file_, content); }

  const ContainerDevice device_{workPersonas()};
  const std::string container_ = "/private/var/mobile/Containers/Data/Application/somewhere";
  const std::string file_ = container_ + "/" + kTSYMetadataFileName;
};

TEST_F(Metadata, whatIsWrittenIsRead) {
  const auto info = std::make_shared<const Value::Dictionary>(
      Value::Dictionary{{"list", Value::Array{1, true, 2.5, "ä\n"}}, {"", Value::Data{0, 255}}});
  std::filesystem::create_directories(device_.path(container_));
  const auto identity = concreteContainerOf(user("E1"), "com.example.ä", 4);
  const TSYMetadata written(identity, info, TSYURL(device_.path(container_)), "assets");
  ASSERT_TRUE(written.writeMetadataToDisk().has_value());
  const auto metadata = read(user("E1"));
  ASSERT_TRUE(metadata.has_value()) << metadata.error().description();
  EXPECT_TRUE(metadata->containerIdentity().isEqualToConcreteContainerIdentity(identity));
  EXPECT_EQ(metadata->userManagedAssetsDirName(), "assets");
  EXPECT_EQ(*metadata->info(), *info);
}

TEST_F(Metadata, checksRunInOrderAndEachNamesItsFault) {
  // One file with every fault; each step reports the first that is left and then mends it.
  Value::Dictionary content{{"TSYMetadataInfo", Value::Array{}},
                            {"TSYMetadataUserManagedAssetsDirName", 1},
                            {"TSYMetadataUserIdentity", "nobody"},
                            {"TSYMetadataPersona", 502}};
  const struct {
    std::string message;
    std::string key;
    std::optional<Value> next;
  } steps[] = {
      {"Invalid metadata Identifier: (null) at ", "TSYMetadataIdentifier", 7},
      {"Invalid metadata Identifier: 7 at ", "TSYMetadataIdentifier", "com.example.app"},
      {"Invalid metadata UUID String: (null) at ", "TSYMetadataUUID", "0F8FAD5B"},
      {"Invalid metadata UUID: 0F8FAD5B at ", "TSYMetadataUUID", kUUID},
      {"Invalid metadata Class: (null) at ", "TSYMetadataContentClass", "2"},
      {"Invalid metadata Class: 2 at ", "TSYMetadataContentClass", 14},
      {"Invalid metadata Content Class: 14 at ", "TSYMetadataContentClass", -1},
      {"Invalid metadata Content Class: -1 at ", "TSYMetadataContentClass", std::nan("")},
      {"Invalid metadata Content Class: 0 at ", "TSYMetadataContentClass", 2},
      {"Incorrect UserId: 502, expecting: 501 for com.example.app at ", "TSYMetadataPersona",
       "501"},
      {"Incorrect UserId: 501, expecting: 501 for com.example.app at ", "TSYMetadataPersona", 501},
      {"Invalid metadata User Identity: nobody for com.example.app at ", "TSYMetadataUserIdentity",
       user("E1")->plist()},
      {"Incorrect User Identity: ", "TSYMetadataUserIdentity", valid()["TSYMetadataUserIdentity"]},
      {"Invalid metadata Info: () at ", "TSYMetadataInfo", std::nullopt},
      {"Invalid metadata User Managed Dir Name String: 1 at ",
       "TSYMetadataUserManagedAssetsDirName", std::nullopt}};
  for (const auto& step : steps) {
    put(content);
    expectFailure(read(user("P")), 29, step.message);
    content.erase(step.key);
    if (step.next) content.emplace(step.key, *step.next);
  }
  put(content);
  EXPECT_TRUE(read(user("P")).has_value());
  content.erase("TSYMetadataUserIdentity");  // as it was written once
  put(content);
  EXPECT_EQ(read(user("P"))->userIdentity()->identifier(), "501");
  // Of a global class, whatever the file says of a user does not count.
  content["TSYMetadataContentClass"] = 12;
  content["TSYMetadataUserIdentity"] = "nobody";
  content["TSYMetadataPersona"] = 7;
  put(content);
  const auto global = read(user("E1"));
  ASSERT_TRUE(global.has_value());
  EXPECT_EQ(global->userIdentity(), TSYUserIdentityCache::defaultUserIdentity());
}

TEST_F(Metadata, theClassPathProvesTheClass) {
  const std::pair<std::string, bool> cases[] = {{"/any/base/Data/Application/x", true},
                                                {"/any/Data/ModulinePlugin/x", false},
                                                {"/any/Data/Application/deeper/x", false},
                                                {"/any/xData/Application/x", false},
                                                {"/any/data/Application/x", false}};
  for (const auto& [path, isValid] : cases) {
    device_.writePropertyList(path + "/" + kTSYMetadataFileName, valid());
    const auto checked = TSYMetadata::readAndValidateMetadataAtUrl(
        TSYURL(device_.path(path)), user("P"), /*checkClassPath=*/true);
    EXPECT_EQ(checked.has_value(), isValid) << path;
    if (!checked) expectFailure(checked, 29, "Invalid metadata-URLs should match: ");
  }
}

TEST_F(Metadata, whatIsNoFileOfADictionaryIsNotRead) {
  const std::string path = device_.path(file_);
  device_.writePropertyList("/valid", valid());
  const std::function<void()> obstacles[] = {
      [] {},
      [&] { device_.write(file_, "bplist00 no more"); },
      [&] { put(Value::Array{valid()}); },
      [&] { std::filesystem::create_symlink(device_.path("/valid"), path); },
      [&] { ASSERT_EQ(::mkfifo(path.c_str(), 0666), 0); },
      [&] {
        put(valid());
        std::filesystem::resize_file(path, platform::PropertyListLimits::kBytes + 1);
      }};
  std::filesystem::create_directories(device_.path(container_));
  for (const auto& obstruct : obstacles) {
    std::filesystem::remove_all(path);
    obstruct();
    expectFailure(read(user("P")), 12, "Failed to read metadata at URL " + path);
  }
}

}  // namespace
