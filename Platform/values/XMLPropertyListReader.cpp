// Reads the XML form. pugixml turns the text into a tree without recursion, at a cost of at most
// some 26 bytes of memory per byte of text; what it leaves open is decided here. It neither checks
// characters nor knows entities, so the text is checked before and references are resolved after:
// the five of XML and numeric ones. A document type is passed over, and what it declares is never
// used: a reference to it is an unknown one.
#include <fmt/format.h>

#include <algorithm>
#include <pugixml.hpp>

#include "Platform/base/WholeNumber.h"
#include "Platform/values/PropertyList.h"
#include "Platform/values/Unicode.h"
#include "Platform/values/XMLPropertyListScalars.h"

namespace platform {
namespace {

using namespace xml_property_list;
using Limits = PropertyListLimits;

constexpr std::string_view kByteOrderMark = "\xEF\xBB\xBF";

// No value is shorter: whoever keeps to the limit of the text keeps to the one of values.
constexpr std::string_view kShortestValue = "<true/>";
static_assert(Limits::kXMLBytes / kShortestValue.size() <= Limits::kValues);

// White space between elements is kept so that text which a comment parts stays whole, and text
// outside the root so that it can be refused.
constexpr unsigned kParseOptions = pugi::parse_cdata | pugi::parse_eol | pugi::parse_ws_pcdata |
                                   pugi::parse_declaration | pugi::parse_fragment;

bool isXMLCharacter(char32_t character) {
  if (character < 0x20) return character == '\t' || character == '\n' || character == '\r';
  return character < 0xD800 || (character > 0xDFFF && character < 0xFFFE) ||
         (character > 0xFFFF && character <= 0x10FFFF);
}

bool isXMLText(std::string_view text) {
  while (!text.empty()) {
    const std::optional<char32_t> character = takeCharacter(text);
    if (!character || !isXMLCharacter(*character)) return false;
  }
  return true;
}

bool isBlank(std::string_view text) {
  return text.find_first_not_of(kSpace) == std::string_view::npos;
}

bool isText(pugi::xml_node node) {
  return node.type() == pugi::node_pcdata || node.type() == pugi::node_cdata;
}

bool isBlankText(pugi::xml_node node) {
  return isText(node) && isBlank(node.value());
}

bool isKnownEncoding(std::string_view name) {
  std::string upper(name);
  std::transform(upper.begin(), upper.end(), upper.begin(),
                 [](char c) { return c >= 'a' && c <= 'z' ? static_cast<char>(c - 0x20) : c; });
  return upper.empty() || upper == "UTF-8" || upper == "US-ASCII" || upper == "ASCII";
}

// The character that a reference stands for, from what is between the ampersand and the semicolon.
std::optional<char32_t> resolveReference(std::string_view name) {
  if (name == "amp") return '&';
  if (name == "lt") return '<';
  if (name == "gt") return '>';
  if (name == "quot") return '"';
  if (name == "apos") return '\'';
  if (!name.starts_with('#')) return std::nullopt;
  name.remove_prefix(1);
  const bool hexadecimal = name.starts_with('x');
  if (hexadecimal) name.remove_prefix(1);
  const auto number = wholeNumber<uint32_t>(name, hexadecimal ? 16 : 10);
  if (!number || !isXMLCharacter(*number)) return std::nullopt;
  return *number;
}

// Appends character data with its references resolved; false for one that stands for nothing.
bool appendResolved(std::string_view text, std::string& into) {
  for (;;) {
    const size_t ampersand = text.find('&');
    into += text.substr(0, ampersand);
    if (ampersand == std::string_view::npos) return true;
    text.remove_prefix(ampersand + 1);
    const size_t semicolon = text.find(';');
    if (semicolon == std::string_view::npos) return false;
    const std::optional<char32_t> character = resolveReference(text.substr(0, semicolon));
    if (!character) return false;
    appendCharacter(into, *character);
    text.remove_prefix(semicolon + 1);
  }
}

// Every function that can fail returns false after it has said why with fail().
class Reader {
 public:
  PropertyListResult<Value> read(std::string_view text) {
    Value root;
    pugi::xml_node element;
    if (parse(text) && findRoot(element) && readValue(element, 0, root)) return root;
    return std::unexpected(PropertyListError{std::move(reason_)});
  }

 private:
  bool fail(std::string_view reason) {
    reason_ = reason;
    return false;
  }
  bool fail(pugi::xml_node node, std::string_view reason) {
    reason_ = fmt::format("at {}: {}", node.offset_debug(), reason);
    return false;
  }

  bool parse(std::string_view text);
  bool findRoot(pugi::xml_node& root);
  bool onlyElement(pugi::xml_node parent, pugi::xml_node& element);

  bool readValue(pugi::xml_node element, size_t depth, Value& into);
  bool readScalar(pugi::xml_node element, std::string_view name, Value& into);
  bool readText(pugi::xml_node element, std::string& into);
  bool readArray(pugi::xml_node element, size_t depth, Value& into);
  bool readDictionary(pugi::xml_node element, size_t depth, Value& into);

  template <typename T>
  bool accept(pugi::xml_node element, std::optional<T> parsed, Value& into) {
    if (!parsed) return fail(element, fmt::format("no valid <{}>", element.name()));
    into = std::move(*parsed);
    return true;
  }

  pugi::xml_document document_;
  std::string reason_;
};

bool Reader::parse(std::string_view text) {
  if (text.size() > Limits::kXMLBytes) return fail("larger than a property list may be");
  if (text.starts_with(kByteOrderMark)) text.remove_prefix(kByteOrderMark.size());
  if (!isXMLText(text)) return fail("not the UTF-8 text that XML is made of");
  const pugi::xml_parse_result result =
      document_.load_buffer(text.data(), text.size(), kParseOptions, pugi::encoding_utf8);
  if (!result) return fail(fmt::format("at {}: {}", result.offset, result.description()));
  return true;
}

// The root value: the one child of <plist>, or the document's own element.
bool Reader::findRoot(pugi::xml_node& root) {
  if (!onlyElement(document_.root(), root)) return false;
  return std::string_view(root.name()) != "plist" || onlyElement(root, root);
}

bool Reader::onlyElement(pugi::xml_node parent, pugi::xml_node& element) {
  element = {};
  for (const pugi::xml_node node : parent) {
    if (node.type() == pugi::node_declaration) {
      if (!isKnownEncoding(node.attribute("encoding").value())) {
        return fail(node, "an encoding other than UTF-8");
      }
    } else if (node.type() == pugi::node_element && !element) {
      element = node;
    } else if (!isBlankText(node)) {
      return fail(node, "something beside the one value");
    }
  }
  return element || fail("no value");
}

bool Reader::readValue(pugi::xml_node element, size_t depth, Value& into) {
  const std::string_view name = element.name();
  if (name != "dict" && name != "array") return readScalar(element, name, into);
  if (depth == Limits::kDepth) return fail(element, "nested too deeply");
  return name == "dict" ? readDictionary(element, depth + 1, into)
                        : readArray(element, depth + 1, into);
}

bool Reader::readScalar(pugi::xml_node element, std::string_view name, Value& into) {
  std::string text;
  if (!readText(element, text)) return false;
  if (name == "string") {
    into = std::move(text);
    return true;
  }
  if (name == "integer") return accept(element, parseInteger(text), into);
  if (name == "real") return accept(element, parseReal(text), into);
  if (name == "date") return accept(element, parseDate(text), into);
  if (name == "data") return accept(element, parseData(text), into);
  if (name != "true" && name != "false") return fail(element, "an unknown element");
  if (!isBlank(text)) return fail(element, "a truth value with a content");
  into = name == "true";
  return true;
}

bool Reader::readText(pugi::xml_node element, std::string& into) {
  for (const pugi::xml_node node : element) {
    if (node.type() == pugi::node_cdata) {
      into += node.value();
    } else if (node.type() != pugi::node_pcdata) {
      return fail(node, "an element where text is due");
    } else if (!appendResolved(node.value(), into)) {
      return fail(node, "an unknown reference");
    }
  }
  return true;
}

bool Reader::readArray(pugi::xml_node element, size_t depth, Value& into) {
  Value::Array array;
  for (const pugi::xml_node node : element) {
    if (isBlankText(node)) continue;
    if (node.type() != pugi::node_element) return fail(node, "text in an array");
    if (!readValue(node, depth, array.emplace_back())) return false;
  }
  into = std::move(array);
  return true;
}

bool Reader::readDictionary(pugi::xml_node element, size_t depth, Value& into) {
  Value::Dictionary dictionary;
  Value* value = nullptr;  // where the next element belongs; none when a key is due
  for (const pugi::xml_node node : element) {
    if (isBlankText(node)) continue;
    if (node.type() != pugi::node_element) return fail(node, "text in a dictionary");
    if (value != nullptr) {
      if (!readValue(node, depth, *value)) return false;
      value = nullptr;
      continue;
    }
    if (std::string_view(node.name()) != "key") return fail(node, "a value without a key");
    std::string key;
    if (!readText(node, key)) return false;
    const auto [place, isNew] = dictionary.try_emplace(std::move(key));
    if (!isNew) return fail(node, "a key that its dictionary has already");
    value = &place->second;
  }
  if (value != nullptr) return fail(element, "a key without a value");
  into = std::move(dictionary);
  return true;
}

}  // namespace

PropertyListResult<Value> readXMLPropertyList(std::string_view text) {
  return Reader().read(text);
}

}  // namespace platform
