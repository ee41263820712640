#include "platform/log/TillLogManager.h"

#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <sstream>

#include "platform/plist/PropertyListSerialization.h"
#include "platform/system/Environment.h"
#include "platform/system/FileIO.h"

namespace larder {

namespace {

constexpr int kDefaultLevel = 2;

int levelFromEnvironment() {
  std::string value = Environment::variable("LARDER_LOG_LEVEL");
  if (value.empty()) return kDefaultLevel;
  return std::atoi(value.c_str());
}

// syslog priorities understood by the journal on standard error.
const char* priorityPrefix(int level) {
  switch (level) {
    case 1:
      return "<3>";
    case 2:
      return "<6>";
    default:
      return "<7>";
  }
}

// Flags, width, precision and length: nothing that would make printf read
// an argument of its own ("*") or write one ("n").
bool isSpecifierPart(char c) {
  return std::string_view("-+ #0123456789.lhzjqtL").find(c) != std::string_view::npos;
}

bool isConversionEnd(char c) {
  return c == '@' || c == 'd' || c == 'i' || c == 'u' || c == 's' || c == 'f' || c == 'g' ||
         c == 'e' || c == 'x' || c == 'X' || c == 'p' || c == 'c' || c == 'o';
}

void describeInto(std::ostringstream& out, const PlistValue& value, int indent);

void describeContainerInto(std::ostringstream& out, const PlistValue& value, int indent) {
  std::string pad(static_cast<std::size_t>(indent + 4), ' ');
  if (const PlistArray* array = value.array()) {
    out << "(\n";
    for (std::size_t i = 0; i < array->size(); ++i) {
      out << pad;
      describeInto(out, (*array)[i], indent + 4);
      out << (i + 1 < array->size() ? ",\n" : "\n");
    }
    out << std::string(static_cast<std::size_t>(indent), ' ') << ")";
    return;
  }
  out << "{\n";
  for (const auto& [key, element] : *value.dictionary()) {
    out << pad << key << " = ";
    describeInto(out, element, indent + 4);
    out << ";\n";
  }
  out << std::string(static_cast<std::size_t>(indent), ' ') << "}";
}

void describeInto(std::ostringstream& out, const PlistValue& value, int indent) {
  switch (value.type()) {
    case PlistValue::Type::Null:
      out << "(null)";
      break;
    case PlistValue::Type::Boolean:
      out << (value.boolValue() ? "1" : "0");
      break;
    case PlistValue::Type::Integer:
      out << value.int64Value();
      break;
    case PlistValue::Type::UnsignedInteger:
      out << value.uint64Value();
      break;
    case PlistValue::Type::Real:
      out << value.doubleValue();
      break;
    case PlistValue::Type::String:
      out << '"' << *value.string() << '"';
      break;
    case PlistValue::Type::Data:
      out << "<" << value.data()->size() << " bytes>";
      break;
    case PlistValue::Type::Date:
      out << "date(" << value.date()->secondsSince1970 << ")";
      break;
    case PlistValue::Type::Uid:
      out << "uid(" << value.uid()->value << ")";
      break;
    case PlistValue::Type::Array:
    case PlistValue::Type::Dictionary:
      describeContainerInto(out, value, indent);
      break;
  }
}

// The first bytes of a long text, cut where a UTF-8 sequence starts, and
// its full length: a client's 10 MB string would otherwise make every line
// that names it 10 MB long.
std::string shortened(const std::string& text) {
  if (text.size() <= LogArgument::kMaxTextBytes) return text;
  std::size_t cut = LogArgument::kMaxTextBytes;
  while (cut > 0 && (static_cast<unsigned char>(text[cut]) & 0xC0) == 0x80) --cut;
  return text.substr(0, cut) + "\u2026(" + std::to_string(text.size()) + " bytes)";
}

}  // namespace

std::string describePlistValue(const PlistValue& value) {
  std::ostringstream out;
  describeInto(out, value, 0);
  return out.str();
}

TillLogManager& TillLogManager::sharedManager() {
  static TillLogManager manager;
  return manager;
}

TillLogManager::TillLogManager() : level_(levelFromEnvironment()) {}

std::string LogArgument::render(std::string_view conversion) const {
  if (const std::string* text = std::get_if<std::string>(&value_)) return shortened(*text);
  char last = conversion.back();
  bool wantsNumber = last != '@' && last != 's' && last != 'c' && last != 'p';
  // printf's length modifiers of the format are replaced by our own, so
  // that "%lu" of a 32-bit and of a 64-bit value both print right.
  std::string flags(conversion.substr(0, conversion.size() - 1));
  std::erase_if(flags, [](char c) {
    return c == 'l' || c == 'h' || c == 'z' || c == 'j' || c == 'q' || c == 't' || c == 'L';
  });
  char buffer[128];
  auto print = [&](auto value, const char* length, char conversionChar) {
    std::string spec = flags + length + conversionChar;
    std::snprintf(buffer, sizeof buffer, spec.c_str(), value);
    return std::string(buffer);
  };
  bool integerConversion =
      last == 'd' || last == 'i' || last == 'u' || last == 'x' || last == 'X' || last == 'o';
  if (const double* real = std::get_if<double>(&value_)) {
    if (wantsNumber && !integerConversion) return print(*real, "", last);
    if (integerConversion) return print(static_cast<long long>(*real), "ll", last);
    return print(*real, "", 'g');
  }
  if (const long long* integer = std::get_if<long long>(&value_)) {
    if (integerConversion) return print(*integer, "ll", last);
    if (wantsNumber) return print(static_cast<double>(*integer), "", last);
    return std::to_string(*integer);
  }
  unsigned long long integer = std::get<unsigned long long>(value_);
  if (integerConversion) return print(integer, "ll", last);
  if (wantsNumber) return print(static_cast<double>(integer), "", last);
  return std::to_string(integer);
}

std::string TillLogManager::formatMessage(std::string_view format,
                                          const std::vector<LogArgument>& args) {
  std::string message;
  message.reserve(format.size() + 64);
  std::size_t next = 0;
  for (std::size_t i = 0; i < format.size(); ++i) {
    if (format[i] != '%' || i + 1 >= format.size()) {
      message += format[i];
      continue;
    }
    if (format[i + 1] == '%') {
      message += '%';
      ++i;
      continue;
    }
    std::size_t end = i + 1;
    while (end < format.size() && isSpecifierPart(format[end])) ++end;
    if (end == format.size() || !isConversionEnd(format[end])) {  // not a conversion after all
      message += format[i];
      continue;
    }
    message += next < args.size() ? args[next++].render(format.substr(i, end - i + 1))
                                  : std::string("(null)");
    i = end;
  }
  return message;
}

void TillLogManager::write(int level, std::string_view function, std::string_view file, int line,
                           const std::string& message) {
  std::string fileName = std::filesystem::path(file).filename().string();
  std::string text = std::string(priorityPrefix(level)) + "[" + std::to_string(level) + "] " +
                     std::string(function) + " (" + fileName + ":" + std::to_string(line) + ") " +
                     message + "\n";
  std::fwrite(text.data(), 1, text.size(), stderr);
  std::vector<std::shared_ptr<Sink>> sinks;
  {
    MutexLock lock(sinksMutex_);
    sinks = sinks_;
  }
  for (const auto& sink : sinks) (*sink)(level, message);
}

void TillLogManager::logLevelForPlist(int level, std::string_view function, std::string_view file,
                                      int line, const PlistValue& plist,
                                      std::string_view filename) {
  if (!isEnabled(level)) return;
  std::string path = Environment::stateDirectory() + "/" + std::string(filename) + ".plist";
  if (auto written = FileIO::writeAtomically(path, PropertyListSerialization::writeXml(plist));
      !written) {
    write(1, function, file, line,
          "TillLogManager: cannot write side file " + written.error().description);
  }
}

std::shared_ptr<void> TillLogManager::addSink(Sink sink) {
  auto shared = std::make_shared<Sink>(std::move(sink));
  {
    MutexLock lock(sinksMutex_);
    sinks_.push_back(shared);
  }
  auto remove = [this, shared](void*) {
    MutexLock lock(sinksMutex_);
    std::erase(sinks_, shared);
  };
  return {static_cast<void*>(shared.get()), remove};
}

int TillDebugLevel() {
  std::string value = Environment::variable("LARDER_DEBUG");
  return value.empty() ? 0 : std::atoi(value.c_str());
}

}  // namespace larder
