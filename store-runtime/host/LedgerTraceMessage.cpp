#include "store-runtime/host/LedgerTraceMessage.h"

#include <fcntl.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <cmath>
#include <cstring>
#include <ctime>
#include <memory>
#include <nlohmann/json.hpp>

#include "platform/dispatch/DispatchQueue.h"
#include "platform/log/TillLogManager.h"
#include "platform/plist/JsonConversion.h"
#include "platform/system/Environment.h"
#include "platform/system/FileDescriptor.h"
#include "platform/system/FileIO.h"

namespace larder {

namespace {

constexpr std::string_view kSpeaker = "LedgerTraceMessage";

DispatchQueue& traceQueue() {
  static const std::shared_ptr<DispatchQueue> queue =
      DispatchQueue::create("LedgerTraceMessage Queue", DispatchQueue::Kind::Serial);
  return *queue;
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
  (void)FileIO::createDirectories(directory);  // a failure shows as the open below failing
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
  record["date"] = JsonConversion::isoDate(date);
  record["domain"] = std::string(domain);
  record["message"] =
      JsonConversion::toJson(PlistValue(message), JsonConversion::DateStyle::ISO8601);
  // Text that is not UTF-8 is replaced rather than refused: a trace is
  // never lost for one odd byte.
  return record.dump(-1, ' ', false, nlohmann::json::error_handler_t::replace);
}

void LedgerTraceMessage(std::string_view domain, const PlistDictionary& message) {
  std::string directory = Environment::stateDirectory();
  std::string path = LedgerTraceMessageLogPath();
  traceQueue().async([directory = std::move(directory), path = std::move(path),
                      domain = std::string(domain), message, date = PlistDate::now()] {
    appendLine(directory, path, LedgerTraceMessageLine(domain, message, date) + "\n");
  });
}

void LedgerTraceMessageWaitUntilWritten() {
  traceQueue().sync([] {});
}

}  // namespace larder
