#include "platform/metadata/MetadataQueryPredicate.h"

#include <algorithm>
#include <charconv>
#include <set>
#include <utility>

namespace larder {

namespace {

enum class Operator { Equal, NotEqual, Less, Greater, LessOrEqual, GreaterOrEqual };

enum class TokenKind { Word, Quoted, Comparison, And, Or, Open, Close, End };

struct Token {
  TokenKind kind = TokenKind::End;
  std::string text;  // without a wildcard star
  bool wildcard = false;
  Operator comparison = Operator::Equal;
  std::size_t offset = 0;
};

struct Literal {
  std::string text;
  bool wildcard = false;
  std::optional<long double> number;
};

constexpr std::string_view kBareWordStops = "()=!<>&|'\"";

bool isSpace(char c) {
  return c == ' ' || c == '\t' || c == '\n' || c == '\r' || c == '\f' || c == '\v';
}

bool endsBareWord(char c) {
  return isSpace(c) || kBareWordStops.find(c) != std::string_view::npos;
}

bool isAttributeStart(char c) {
  return (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || c == '_';
}

bool isAttributeName(std::string_view word) {
  if (word.empty() || !isAttributeStart(word.front())) return false;
  return std::all_of(word.begin(), word.end(),
                     [](char c) { return isAttributeStart(c) || (c >= '0' && c <= '9'); });
}

// Only texts that look like numbers: "inf" and "nan" stay words. Read as long double, which
// holds every int64 exactly on the targets we build for, so that large identifiers compare
// exactly.
std::optional<long double> numberFromText(std::string_view text) {
  if (!text.empty() && text.front() == '+') text.remove_prefix(1);
  const std::size_t digitsStart = !text.empty() && text.front() == '-' ? 1 : 0;
  if (text.size() <= digitsStart) return std::nullopt;
  const char first = text[digitsStart];
  if (!((first >= '0' && first <= '9') || first == '.')) return std::nullopt;
  long double number = 0;
  const char* end = text.data() + text.size();
  auto [stop, error] = std::from_chars(text.data(), end, number);
  if (error != std::errc() || stop != end) return std::nullopt;
  return number;
}

class Lexer {
 public:
  explicit Lexer(std::string_view text) : text_(text) {}

  std::optional<Token> next(std::string& error) {
    while (position_ < text_.size() && isSpace(text_[position_])) ++position_;
    Token token;
    token.offset = position_;
    if (position_ == text_.size()) return token;
    const char c = text_[position_];
    if (c == '(' || c == ')') {
      ++position_;
      token.kind = c == '(' ? TokenKind::Open : TokenKind::Close;
      return token;
    }
    if (c == '\'' || c == '"') return quoted(token, error);
    if (std::string_view("=!<>&|").find(c) != std::string_view::npos) return symbol(token, error);
    return bareWord(token);
  }

 private:
  bool startsWith(std::string_view symbol) const {
    return text_.substr(position_, symbol.size()) == symbol;
  }

  std::optional<Token> symbol(Token token, std::string& error) {
    struct Spelling {
      std::string_view text;
      TokenKind kind;
      Operator comparison;
    };
    // Longest first, so that "<=" is not read as "<" followed by "=".
    static constexpr Spelling kSpellings[] = {
        {"==", TokenKind::Comparison, Operator::Equal},
        {"!=", TokenKind::Comparison, Operator::NotEqual},
        {"<=", TokenKind::Comparison, Operator::LessOrEqual},
        {">=", TokenKind::Comparison, Operator::GreaterOrEqual},
        {"&&", TokenKind::And, Operator::Equal},
        {"||", TokenKind::Or, Operator::Equal},
        {"=", TokenKind::Comparison, Operator::Equal},
        {"<", TokenKind::Comparison, Operator::Less},
        {">", TokenKind::Comparison, Operator::Greater},
    };
    for (const Spelling& spelling : kSpellings) {
      if (!startsWith(spelling.text)) continue;
      position_ += spelling.text.size();
      token.kind = spelling.kind;
      token.comparison = spelling.comparison;
      return token;
    }
    error = "unexpected '" + std::string(1, text_[position_]) + "' at offset " +
            std::to_string(position_);
    return std::nullopt;
  }

  std::optional<Token> quoted(Token token, std::string& error) {
    const char quote = text_[position_++];
    bool lastWasEscaped = false;
    while (position_ < text_.size() && text_[position_] != quote) {
      char c = text_[position_++];
      lastWasEscaped = c == '\\';
      if (lastWasEscaped) {
        if (position_ == text_.size()) break;
        c = text_[position_++];
      }
      token.text.push_back(c);
    }
    if (position_ == text_.size()) {
      error = "unterminated quoted value at offset " + std::to_string(token.offset);
      return std::nullopt;
    }
    ++position_;
    token.kind = TokenKind::Quoted;
    if (!lastWasEscaped && !token.text.empty() && token.text.back() == '*') {
      token.text.pop_back();
      token.wildcard = true;
    }
    return token;
  }

  Token bareWord(Token token) {
    const std::size_t start = position_;
    while (position_ < text_.size() && !endsBareWord(text_[position_])) ++position_;
    token.kind = TokenKind::Word;
    token.text = std::string(text_.substr(start, position_ - start));
    if (token.text.back() == '*') {
      token.text.pop_back();
      token.wildcard = true;
    }
    return token;
  }

  std::string_view text_;
  std::size_t position_ = 0;
};

}  // namespace

struct MetadataQueryPredicate::Node {
  enum class Kind { Comparison, All, Any };
  Kind kind = Kind::Comparison;
  std::string attribute;
  Operator comparison = Operator::Equal;
  Literal literal;
  std::vector<Node> children;
};

namespace {

using Node = MetadataQueryPredicate::Node;

class Parser {
 public:
  explicit Parser(std::string_view text) : lexer_(text) {}

  std::optional<Node> parseQuery() {
    if (!advance()) return std::nullopt;
    std::optional<Node> root = disjunction(0);
    if (!root) return std::nullopt;
    if (current_.kind != TokenKind::End) return fail("unexpected text");
    return root;
  }

  [[nodiscard]] const std::string& error() const { return error_; }

 private:
  bool advance() {
    std::optional<Token> token = lexer_.next(error_);
    if (!token) return false;
    current_ = std::move(*token);
    return true;
  }

  std::nullopt_t fail(std::string_view what) {
    if (error_.empty()) {
      error_ = std::string(what) + " at offset " + std::to_string(current_.offset);
    }
    return std::nullopt;
  }

  // Children of the same kind are spliced in, so "(a || b) || c" is one list of three.
  static void append(Node& group, Node child) {
    if (child.kind == group.kind) {
      for (Node& grandchild : child.children) group.children.push_back(std::move(grandchild));
    } else {
      group.children.push_back(std::move(child));
    }
  }

  template <typename Operand>
  std::optional<Node> group(Node::Kind kind, TokenKind separator, std::size_t depth,
                            Operand operand) {
    std::optional<Node> first = (this->*operand)(depth);
    if (!first) return std::nullopt;
    if (current_.kind != separator) return first;
    Node node;
    node.kind = kind;
    append(node, std::move(*first));
    while (current_.kind == separator) {
      if (!advance()) return std::nullopt;
      std::optional<Node> next = (this->*operand)(depth);
      if (!next) return std::nullopt;
      append(node, std::move(*next));
    }
    return node;
  }

  std::optional<Node> disjunction(std::size_t depth) {
    return group(Node::Kind::Any, TokenKind::Or, depth, &Parser::conjunction);
  }

  std::optional<Node> conjunction(std::size_t depth) {
    return group(Node::Kind::All, TokenKind::And, depth, &Parser::primary);
  }

  std::optional<Node> primary(std::size_t depth) {
    if (current_.kind != TokenKind::Open) return comparison();
    if (depth + 1 > MetadataQueryPredicate::kMaxNestingDepth) return fail("nested too deeply");
    if (!advance()) return std::nullopt;
    std::optional<Node> inner = disjunction(depth + 1);
    if (!inner) return std::nullopt;
    if (current_.kind != TokenKind::Close) return fail("expected ')'");
    if (!advance()) return std::nullopt;
    return inner;
  }

  std::optional<Node> comparison() {
    if (current_.kind != TokenKind::Word || current_.wildcard || !isAttributeName(current_.text)) {
      return fail("expected an attribute name");
    }
    Node node;
    node.attribute = std::move(current_.text);
    if (!advance()) return std::nullopt;
    if (current_.kind != TokenKind::Comparison) return fail("expected a comparison operator");
    node.comparison = current_.comparison;
    if (!advance()) return std::nullopt;
    if (current_.kind != TokenKind::Word && current_.kind != TokenKind::Quoted) {
      return fail("expected a value");
    }
    node.literal.text = std::move(current_.text);
    node.literal.wildcard = current_.wildcard;
    if (!node.literal.wildcard) node.literal.number = numberFromText(node.literal.text);
    if (!advance()) return std::nullopt;
    return node;
  }

  Lexer lexer_;
  Token current_;
  std::string error_;
};

template <typename T>
bool ordered(const T& left, Operator comparison, const T& right) {
  switch (comparison) {
    case Operator::Equal:
      return left == right;
    case Operator::NotEqual:
      return !(left == right);
    case Operator::Less:
      return left < right;
    case Operator::Greater:
      return right < left;
    case Operator::LessOrEqual:
      return !(right < left);
    case Operator::GreaterOrEqual:
      return !(left < right);
  }
  return false;
}

std::optional<long double> numberOfAttribute(const PlistValue& value) {
  switch (value.type()) {
    case PlistValue::Type::Boolean:
    case PlistValue::Type::Integer:
      return static_cast<long double>(value.int64Value());
    case PlistValue::Type::UnsignedInteger:
      return static_cast<long double>(value.uint64Value());
    case PlistValue::Type::Real:
      return static_cast<long double>(value.doubleValue());
    case PlistValue::Type::Date:
      return static_cast<long double>(value.date()->secondsSince1970);
    case PlistValue::Type::String:
      return numberFromText(*value.string());
    default:
      return std::nullopt;
  }
}

bool compareStrings(const std::string& value, Operator comparison, const Literal& literal) {
  if (literal.wildcard && (comparison == Operator::Equal || comparison == Operator::NotEqual)) {
    const bool hasPrefix = value.compare(0, literal.text.size(), literal.text) == 0;
    return comparison == Operator::Equal ? hasPrefix : !hasPrefix;
  }
  const std::string pattern = literal.wildcard ? literal.text + "*" : literal.text;
  return ordered(std::string_view(value), comparison, std::string_view(pattern));
}

bool unrelated(Operator comparison) {
  return comparison == Operator::NotEqual;
}

bool compare(const PlistValue& value, Operator comparison, const Literal& literal) {
  if (value.isNull()) return unrelated(comparison);
  const std::optional<long double> number = numberOfAttribute(value);
  if (number && literal.number) {
    return ordered(*number, comparison, *literal.number);
  }
  if (const std::string* text = value.string()) return compareStrings(*text, comparison, literal);
  return unrelated(comparison);
}

bool evaluate(const Node& node, const PlistDictionary& attributes) {
  switch (node.kind) {
    case Node::Kind::Comparison: {
      auto found = attributes.find(node.attribute);
      const PlistValue& value = found == attributes.end() ? PlistValue::null() : found->second;
      return compare(value, node.comparison, node.literal);
    }
    case Node::Kind::All:
      return std::all_of(node.children.begin(), node.children.end(),
                         [&](const Node& child) { return evaluate(child, attributes); });
    case Node::Kind::Any:
      return std::any_of(node.children.begin(), node.children.end(),
                         [&](const Node& child) { return evaluate(child, attributes); });
  }
  return false;
}

void collectAttributes(const Node& node, std::set<std::string>& names) {
  if (node.kind == Node::Kind::Comparison) names.insert(node.attribute);
  for (const Node& child : node.children) collectAttributes(child, names);
}

std::string_view spelling(Operator comparison) {
  switch (comparison) {
    case Operator::Equal:
      return "==";
    case Operator::NotEqual:
      return "!=";
    case Operator::Less:
      return "<";
    case Operator::Greater:
      return ">";
    case Operator::LessOrEqual:
      return "<=";
    case Operator::GreaterOrEqual:
      return ">=";
  }
  return "==";
}

std::string quotedText(const Literal& literal) {
  std::string text = "\"";
  for (char c : literal.text) {
    if (c == '"' || c == '\\' || c == '*') text.push_back('\\');
    text.push_back(c);
  }
  if (literal.wildcard) text.push_back('*');
  text.push_back('"');
  return text;
}

void print(const Node& node, std::string& text) {
  if (node.kind == Node::Kind::Comparison) {
    text += node.attribute + " " + std::string(spelling(node.comparison)) + " " +
            quotedText(node.literal);
    return;
  }
  const std::string_view separator = node.kind == Node::Kind::All ? " && " : " || ";
  for (std::size_t index = 0; index < node.children.size(); ++index) {
    if (index > 0) text += separator;
    const Node& child = node.children[index];
    // Only a disjunction inside a conjunction needs parentheses to keep its meaning.
    const bool parenthesize = node.kind == Node::Kind::All && child.kind == Node::Kind::Any;
    if (parenthesize) text += "(";
    print(child, text);
    if (parenthesize) text += ")";
  }
}

}  // namespace

Result<MetadataQueryPredicate> MetadataQueryPredicate::parse(std::string_view text) {
  const auto refused = [](std::string why) {
    return VendError::withDomain(std::string(kErrorDomain), 1, std::move(why));
  };
  if (text.size() > kMaxQueryLength) {
    return refused("query longer than " + std::to_string(kMaxQueryLength) + " bytes");
  }
  Parser parser(text);
  std::optional<Node> root = parser.parseQuery();
  if (!root) return refused(parser.error());
  return MetadataQueryPredicate(std::make_shared<const Node>(std::move(*root)));
}

bool MetadataQueryPredicate::matches(const PlistDictionary& attributes) const {
  return evaluate(*root_, attributes);
}

std::vector<std::string> MetadataQueryPredicate::attributeNames() const {
  std::set<std::string> names;
  collectAttributes(*root_, names);
  return {names.begin(), names.end()};
}

std::string MetadataQueryPredicate::canonicalText() const {
  std::string text;
  print(*root_, text);
  return text;
}

}  // namespace larder
