#include "Tools/tessaryctl/Output.h"

#include <fmt/format.h>

#include <algorithm>
#include <nlohmann/json.hpp>

#include "Tools/tessaryctl/ValueJSON.h"

using nlohmann::ordered_json;

namespace {

void printJSON(const ordered_json& value) {
  // What is not UTF-8 (a path may be anything) is shown with replacement characters.
  constexpr int kIndent = 2;
  fmt::print("{}\n", value.dump(kIndent, ' ', /*ensure_ascii=*/false,
                                ordered_json::error_handler_t::replace));
}

}  // namespace

void Output::print(const tessary::Container& container) const {
  if (json) {
    ordered_json value = {{"identifier", container.identifier},
                          {"uuid", container.uuid.string()},
                          {"path", container.path},
                          {"existed", container.existed}};
    if (container.personaUniqueString) value["persona"] = *container.personaUniqueString;
    if (container.sandboxToken) value["sandboxToken"] = *container.sandboxToken;
    printJSON(value);
    return;
  }
  fmt::print("identifier  {}\n", container.identifier);
  fmt::print("uuid        {}\n", container.uuid.string());
  fmt::print("path        {}\n", container.path);
  fmt::print("existed     {}\n", container.existed ? "yes" : "no");
  if (container.personaUniqueString) fmt::print("persona     {}\n", *container.personaUniqueString);
  if (container.sandboxToken) fmt::print("token       {}\n", *container.sandboxToken);
}

void Output::print(const std::vector<tessary::ListedContainer>& containers) const {
  if (json) {
    ordered_json list = ordered_json::array();
    for (const auto& container : containers) {
      list.push_back({{"identifier", container.identifier},
                      {"uuid", container.uuid.string()},
                      {"persona", container.personaUniqueString}});
    }
    printJSON(list);
    return;
  }
  size_t width = std::string_view("IDENTIFIER").size();
  for (const auto& container : containers) width = std::max(width, container.identifier.size());
  fmt::print("{:<{}}  {:<36}  {}\n", "IDENTIFIER", width, "UUID", "PERSONA");
  for (const auto& container : containers) {
    fmt::print("{:<{}}  {:<36}  {}\n", container.identifier, width, container.uuid.string(),
               container.personaUniqueString.empty() ? "-" : container.personaUniqueString);
  }
}

void Output::print(const tessary::Metadata& metadata) const {
  const std::string info = metadata.info ? jsonOfValue(*metadata.info) : std::string();
  if (json) {
    ordered_json value = {{"path", metadata.path}, {"transient", metadata.transient}};
    if (metadata.info) value["info"] = ordered_json::parse(info);
    if (metadata.personaUniqueString) value["persona"] = *metadata.personaUniqueString;
    if (metadata.sandboxToken) value["sandboxToken"] = *metadata.sandboxToken;
    printJSON(value);
    return;
  }
  fmt::print("path        {}\n", metadata.path);
  fmt::print("transient   {}\n", metadata.transient ? "yes" : "no");
  if (metadata.info) fmt::print("info        {}\n", info);
  if (metadata.personaUniqueString) fmt::print("persona     {}\n", *metadata.personaUniqueString);
  if (metadata.sandboxToken) fmt::print("token       {}\n", *metadata.sandboxToken);
}

void Output::print(const std::vector<tessary::GroupContainer>& containers) const {
  if (json) {
    ordered_json list = ordered_json::array();
    for (const auto& container : containers) {
      ordered_json value = {{"identifier", container.identifier}, {"path", container.path}};
      if (container.personaUniqueString) value["persona"] = *container.personaUniqueString;
      if (container.sandboxToken) value["sandboxToken"] = *container.sandboxToken;
      list.push_back(std::move(value));
    }
    printJSON(list);
    return;
  }
  size_t width = std::string_view("GROUP").size();
  for (const auto& container : containers) width = std::max(width, container.identifier.size());
  fmt::print("{:<{}}  {}\n", "GROUP", width, "PATH");
  for (const auto& container : containers) {
    fmt::print("{:<{}}  {}\n", container.identifier, width, container.path);
    const auto printBelow = [&](const char* what, const std::optional<std::string>& text) {
      if (text) fmt::print("{:<{}}  {:<7}  {}\n", "", width, what, *text);
    };
    printBelow("persona", container.personaUniqueString);
    printBelow("token", container.sandboxToken);
  }
}

void Output::print(const tessary::UserManagedAssets& assets) const {
  if (json) {
    printJSON({{"path", assets.path}, {"existed", assets.existed}});
    return;
  }
  fmt::print("path        {}\n", assets.path);
  fmt::print("existed     {}\n", assets.existed ? "yes" : "no");
}

void Output::print(const std::string& key, const std::string& text) const {
  if (json) {
    printJSON({{key, text}});
  } else {
    fmt::print("{}\n", text);
  }
}

void Output::print(const std::string& key, const std::vector<std::string>& texts) const {
  if (json) {
    printJSON({{key, texts}});
    return;
  }
  for (const std::string& text : texts) fmt::print("{}\n", text);
}

int complain(const tessary::Error& error) {
  if (error.kind != tessary::Error::Kind::daemon) {
    fmt::print(stderr, "tessaryctl: {}\n", error.text);
    return kUnusable;
  }
  fmt::print(stderr, "tessaryctl: {} ({}): {}\n", error.text.empty() ? "TSYError" : error.text,
             error.code, tessary::errorMessage(error.code));
  return kRefused;
}

int complain(const std::string& usage) {
  fmt::print(stderr, "tessaryctl: {}\n", usage);
  return kUnusable;
}
