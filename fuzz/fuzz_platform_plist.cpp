// Property-list reading on arbitrary bytes, binary or XML. Whatever is
// accepted must survive a binary write and a second read unchanged.

#include <cmath>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <span>
#include <string>

#include "platform/plist/PropertyListSerialization.h"
#include "platform/value/PlistValue.h"

namespace {

using larder::PlistArray;
using larder::PlistDictionary;
using larder::PlistValue;
using larder::PropertyListSerialization;

bool sameReal(double a, double b) {
  return (std::isnan(a) && std::isnan(b)) || a == b;
}

// Deep equality in which NaN equals NaN: a NaN real or date read from the
// input is carried faithfully, but never compares equal to itself.
bool sameValue(const PlistValue& a, const PlistValue& b) {
  if (a.type() != b.type()) return false;
  switch (a.type()) {
    case PlistValue::Type::Real:
      return sameReal(a.doubleValue(), b.doubleValue());
    case PlistValue::Type::Date:
      return sameReal(a.date()->secondsSince1970, b.date()->secondsSince1970);
    case PlistValue::Type::Array: {
      const PlistArray& left = *a.array();
      const PlistArray& right = *b.array();
      if (left.size() != right.size()) return false;
      for (std::size_t index = 0; index < left.size(); ++index) {
        if (!sameValue(left[index], right[index])) return false;
      }
      return true;
    }
    case PlistValue::Type::Dictionary: {
      const PlistDictionary& left = *a.dictionary();
      const PlistDictionary& right = *b.dictionary();
      if (left.size() != right.size()) return false;
      for (auto l = left.begin(), r = right.begin(); l != left.end(); ++l, ++r) {
        if (l->first != r->first || !sameValue(l->second, r->second)) return false;
      }
      return true;
    }
    default:
      return a == b;
  }
}

[[noreturn]] void failWith(const char* message, const std::string& detail = "") {
  std::fprintf(stderr, "%s %s\n", message, detail.c_str());
  std::abort();
}

// Tight enough that a small input expanding through shared references stays
// within the fuzzer's memory limit.
larder::PlistReadLimits fuzzLimits() {
  larder::PlistReadLimits limits;
  limits.maxBytes = 4u * 1024u * 1024u;
  limits.maxObjects = 200'000;
  return limits;
}

// libplist frees its trees recursively, so the XML reader must refuse deep
// documents before libplist parses them; the check on the parsed tree is only
// a second line. With a small depth limit the fuzzer reaches it easily, and
// reaching it means the first line let a document through.
void checkXmlDepthScan(std::span<const std::uint8_t> bytes) {
  larder::PlistReadLimits shallow = fuzzLimits();
  shallow.maxDepth = 3;
  const std::string error = PropertyListSerialization::readXml(bytes, shallow).errorDescription();
  if (error.find("parsed tree nested deeper") != std::string::npos) {
    failWith("nesting scan missed depth:", error);
  }
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  const std::span<const std::uint8_t> bytes(data, size);
  if (size > 0 && data[0] != 'b') checkXmlDepthScan(bytes);
  const auto value = PropertyListSerialization::read(bytes, fuzzLimits());
  if (!value) {
    if (value.errorDescription().empty()) failWith("refused without an error text");
    return 0;
  }
  if (value->isNull()) failWith("accepted a document as a null value");

  const larder::PlistData encoded = PropertyListSerialization::writeBinary(*value);
  const auto again = PropertyListSerialization::readBinary(encoded);
  if (!again) failWith("could not read back its own encoding:", again.errorDescription());
  if (!sameValue(*value, *again)) failWith("value changed in a binary write and read");

  // The XML writer goes through libplist; it only has to cope.
  const std::string xml = PropertyListSerialization::writeXml(*value);
  if (xml.empty()) failWith("XML writer produced nothing");
  (void)PropertyListSerialization::read(xml);
  return 0;
}
