// The metadata query language on arbitrary text. Whatever parses must print a canonical text
// that parses to the same canonical text and decides every sample the same way; whatever does
// not parse must say why.

#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <string>
#include <string_view>
#include <vector>

#include "platform/metadata/MetadataQueryPredicate.h"
#include "platform/value/PlistValue.h"

namespace {

using larder::MetadataQueryPredicate;
using larder::PlistDictionary;
using larder::PlistValue;

[[noreturn]] void failWith(const char* message, const std::string& detail = "") {
  std::fprintf(stderr, "%s %s\n", message, detail.c_str());
  std::abort();
}

// Samples that give every attribute the predicate reads a value of each kind, plus the
// attributes of a store bundle, so that both branches of most comparisons are taken.
std::vector<PlistDictionary> samplesFor(const MetadataQueryPredicate& predicate) {
  const std::vector<PlistValue> kinds{PlistValue(),
                                      PlistValue(std::int64_t{1}),
                                      PlistValue(0.5),
                                      PlistValue("com.orvane.SetupHerald"),
                                      PlistValue("10"),
                                      PlistValue(true),
                                      PlistValue(larder::PlistDate{1.0e9}),
                                      PlistValue(larder::PlistArray{})};
  std::vector<PlistDictionary> samples;
  for (const PlistValue& kind : kinds) {
    PlistDictionary sample;
    for (const std::string& name : predicate.attributeNames()) {
      if (!kind.isNull()) sample.insert_or_assign(name, kind);
    }
    samples.push_back(std::move(sample));
  }
  samples.push_back({{"kHostItemQuaymartHasPurchaseRecord", std::int64_t{1}},
                     {"kHostItemHostBundleIdentifier", "com.example.Notes"},
                     {"kHostItemContentType", "com.orvane.application-bundle"}});
  return samples;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  const std::string_view text(reinterpret_cast<const char*>(data), size);
  const auto predicate = MetadataQueryPredicate::parse(text);
  if (!predicate) {
    if (predicate.error().description.empty()) failWith("refused without a reason");
    return 0;
  }
  const std::string canonical = predicate->canonicalText();
  const auto again = MetadataQueryPredicate::parse(canonical);
  if (!again) {
    failWith("canonical text does not parse:", canonical + " -- " + again.error().description);
  }
  if (again->canonicalText() != canonical) {
    failWith("canonical text is not stable:", canonical + " -> " + again->canonicalText());
  }
  if (again->attributeNames() != predicate->attributeNames()) {
    failWith("canonical text reads other attributes:", canonical);
  }
  for (const PlistDictionary& sample : samplesFor(*predicate)) {
    if (predicate->matches(sample) != again->matches(sample)) {
      failWith("canonical text decides differently:", canonical);
    }
  }
  return 0;
}
