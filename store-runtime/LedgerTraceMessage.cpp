#include "store-runtime/LedgerTraceMessage.h"

#include <fcntl.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <cmath>
#include <cstring>
#include <ctime>
#include <memory>
#include <nlohmann/json.hpp>

#include "platform/DispatchQueue.h"
#include "platform/Environment.h"
#include "platform/FileDescriptor.h"
#include "platform/FileIO.h"
#include "store-runtime/TillLogManager.h"

namespace larder {

namespace {

constexpr std::string_view kSpeaker = "LedgerTraceMessage";

DispatchQueue& traceQueue() {
  static const std::shared_ptr<DispatchQueue> queue =
      DispatchQueue::create("LedgerTraceMessage Queue", DispatchQueue::Kind::Serial);
  return *queue;
}

std::string isoDate(PlistDate date) {
  double whole = std::floor(date.secondsSince1970);
  auto seconds = static_cast<std::time_t>(whole);
  std::tm utc{};
  if (::gmtime_r(&seconds, &utc) == nullptr) return {};
  char text[32];
  std::size_t length = std::strftime(text, sizeof text, "%Y-%m-%dT%H:%M:%SZ", &utc);
  return std::string(text, length);
}

std::string base64(const PlistData& data) {
  static constexpr char kAlphabet[] =
      "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789+/";
  std::string text;
  text.reserve((data.size() + 2) / 3 * 4);
  for (std::size_t i = 0; i < data.size(); i += 3) {
    std::uint32_t group = std::uint32_t{data[i]} << 16u;
    if (i + 1 < data.size()) group |= std::uint32_t{data[i + 1]} << 8u;
    if (i + 2 < data.size()) group |= std::uint32_t{data[i + 2]};
    text.push_back(kAlphabet[(group >> 18u) & 63u]);
    text.push_back(kAlphabet[(group >> 12u) & 63u]);
    text.push_back(i + 1 < data.size() ? kAlphabet[(group >> 6u) & 63u] : '=');
    text.push_back(i + 2 < data.size() ? kAlphabet[group & 63u] : '=');
  }
  return text;
}

nlohmann::json toJson(const PlistValue& value) {
  switch (value.type()) {
    case PlistValue::Type::Null:
      return nullptr;
    case PlistValue::Type::Boolean:
      return value.boolValue();
    case PlistValue::Type::Integer:
      return value.int64Value();
    case PlistValue::Type::UnsignedInteger:
      return value.uint64Value();
    case PlistValue::Type::Real:
      return value.doubleValue();
    case PlistValue::Type::String:
      return *value.string();
    case PlistValue::Type::Data:
      return base64(*value.data());
    case PlistValue::Type::Date:
      return isoDate(*value.date());
    case PlistValue::Type::Array: {
      nlohmann::json array = nlohmann::json::array();
      for (const PlistValue& element : *value.array()) array.push_back(toJson(element));
      return array;
    }
    case PlistValue::Type::Dictionary: {
      nlohmann::json object = nlohmann::json::object();
      for (const auto& [key, element] : *value.dictionary()) object[key] = toJson(element);
      return object;
    }
    case PlistValue::Type::Uid:
      return value.uid()->value;
  }
  return nullptr;
}

PlistDate now() {
  auto since = std::chrono::system_clock::now().time_since_epoch();
  return PlistDate{std::chrono::duration<double>(since).count()};
}

bool writeWholeLine(int fd, const std::string& line) {
  std::size_t written = 0;
  while (written < line.size()) {
    ssize_t result = ::write(fd, line.data() + written, line.size() - written);
    if (result < 0) {
      if (errno == EINTR) continue;
      return false;
    }
    written += static_cast<std::size_t>(result);
  }
  return true;
}

// Runs on the trace queue only, so lines of this process never interleave;
// O_APPEND keeps whole lines apart from other processes' too.
void appendLine(const std::string& directory, const std::string& path, const std::string& line) {
  FileIO::createDirectories(directory);
  FileDescriptor file(::open(path.c_str(), O_WRONLY | O_APPEND | O_CREAT | O_CLOEXEC, 0600));
  if (!file.valid() || !writeWholeLine(file.get(), line)) {
    TILL_LOG(1, "%@: Cannot write the message trace to %@: %@", kSpeaker, path,
             std::string(std::strerror(errno)));
  }
}

}  // namespace

std::string LedgerTraceMessageLogPath() {
  return Environment::stateDirectory() + "/messagetrace.log";
}

std::string LedgerTraceMessageLine(std::string_view domain, const PlistDictionary& message,
                                   PlistDate date) {
  nlohmann::json record = nlohmann::json::object();
  record["date"] = isoDate(date);
  record["domain"] = std::string(domain);
  record["message"] = toJson(PlistValue(message));
  // Text that is not UTF-8 is replaced rather than refused: a trace is
  // never lost for one odd byte.
  return record.dump(-1, ' ', false, nlohmann::json::error_handler_t::replace);
}

void LedgerTraceMessage(std::string_view domain, const PlistDictionary& message) {
  std::string directory = Environment::stateDirectory();
  std::string path = LedgerTraceMessageLogPath();
  traceQueue().async([directory = std::move(directory), path = std::move(path),
                      domain = std::string(domain), message, date = now()] {
    appendLine(directory, path, LedgerTraceMessageLine(domain, message, date) + "\n");
  });
}

void LedgerTraceMessageWaitUntilWritten() {
  traceQueue().sync([] {});
}

}  // namespace larder
