#pragma once

#include <cstddef>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/error/Result.h"
#include "platform/value/PlistValue.h"

namespace larder {

// The query language of the metadata index:
//
//   query       := disjunction
//   disjunction := conjunction ( "||" conjunction )*
//   conjunction := primary ( "&&" primary )*
//   primary     := "(" disjunction ")" | comparison
//   comparison  := attribute operator value
//   operator    := "==" | "=" | "!=" | "<" | ">" | "<=" | ">="
//   attribute   := letter or "_", then letters, digits and "_"
//   value       := 'text' | "text" | bare word
//
// A bare word runs up to white space or one of ( ) = ! < > & | ' "; it may hold dots, dashes and
// stars ("com.orvane.application-bundle"). In quotes, a backslash takes the next character as it
// is, so \' \" \\ and \* (a star that is not a wildcard) can be written.
//
// Comparing:
//  - A value that ends in an unescaped "*" matches by prefix with "==" and "!="; the ordering
//    operators take the star as a character.
//  - When the attribute is a number (integer, real, boolean) or a date (seconds since 1970) and
//    the value reads as a number, they compare as numbers. A string attribute compares as a
//    number too when both texts read as numbers; otherwise strings compare byte by byte.
//  - An absent attribute equals nothing: every comparison with it is false except "!=".
//  - A number attribute against a value that is not a number, and any attribute of another
//    type (data, array, dictionary), is unequal to the value and unordered with it.
//
// Parsing refuses, with a reason, anything else, and bounds the input: at most kMaxQueryLength
// bytes and kMaxNestingDepth levels of parentheses, so that stack use does not depend on what
// a caller passes.
class MetadataQueryPredicate {
 public:
  static constexpr std::size_t kMaxQueryLength = 64u * 1024u;
  static constexpr std::size_t kMaxNestingDepth = 32;

  // A query that does not parse is an error of kErrorDomain whose
  // description says what is wrong and at which offset.
  static constexpr std::string_view kErrorDomain = "MetadataQueryPredicate";
  static Result<MetadataQueryPredicate> parse(std::string_view text);

  [[nodiscard]] bool matches(const PlistDictionary& attributes) const;

  // Attribute names the predicate reads, sorted, each once.
  [[nodiscard]] std::vector<std::string> attributeNames() const;

  // A canonical text of the predicate, with every comparison in parentheses and values quoted;
  // parsing it gives a predicate with the same canonical text.
  [[nodiscard]] std::string canonicalText() const;

  struct Node;

 private:
  explicit MetadataQueryPredicate(std::shared_ptr<const Node> root) : root_(std::move(root)) {}
  // Shared so that copies of a parsed predicate cost nothing; the tree is never changed.
  std::shared_ptr<const Node> root_;
};

}  // namespace larder
