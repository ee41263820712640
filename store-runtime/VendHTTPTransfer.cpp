#include "store-runtime/VendHTTPTransfer.h"

#include <curl/curl.h>

#include <algorithm>
#include <cmath>
#include <memory>
#include <mutex>

namespace larder {
namespace {

void initializeCurlOnce() {
  static std::once_flag once;
  std::call_once(once, [] { curl_global_init(CURL_GLOBAL_DEFAULT); });
}

struct EasyDeleter {
  void operator()(CURL* handle) const { curl_easy_cleanup(handle); }
};
struct ListDeleter {
  void operator()(curl_slist* list) const { curl_slist_free_all(list); }
};

// What the callbacks share while one transfer runs.
struct TransferState {
  const VendHTTPTransfer::Options* options = nullptr;
  VendHTTPTransfer::Result* result = nullptr;
  bool headDelivered = false;
  bool aborted = false;
  bool tooLarge = false;

  void deliverHead() {
    if (headDelivered) return;
    headDelivered = true;
    if (options->onResponse) options->onResponse(result->response);
  }
};

std::string trimmed(std::string_view text) {
  const auto first = text.find_first_not_of(" \t\r\n");
  if (first == std::string_view::npos) return {};
  const auto last = text.find_last_not_of(" \t\r\n");
  return std::string(text.substr(first, last - first + 1));
}

// "HTTP/1.1 206 Partial Content" -> 206; 0 when the line has no code.
long statusCodeOf(std::string_view statusLine) {
  const auto space = statusLine.find(' ');
  if (space == std::string_view::npos) return 0;
  long code = 0;
  for (std::size_t i = space + 1; i < statusLine.size() && i < space + 4; ++i) {
    if (statusLine[i] < '0' || statusLine[i] > '9') return 0;
    code = code * 10 + (statusLine[i] - '0');
  }
  return code;
}

std::size_t receiveHeader(char* buffer, std::size_t size, std::size_t count, void* context) {
  auto& state = *static_cast<TransferState*>(context);
  const std::string_view line(buffer, size * count);
  if (line.starts_with("HTTP/")) {
    // A new status line: an interim or redirected answer's headers go, and
    // its status is the one `onResponse` sees.
    state.result->response.headers.clear();
    state.result->response.statusCode = statusCodeOf(line);
    return line.size();
  }
  const auto colon = line.find(':');
  if (colon != std::string_view::npos) {
    state.result->response.headers.emplace_back(trimmed(line.substr(0, colon)),
                                                trimmed(line.substr(colon + 1)));
  }
  return line.size();
}

std::size_t receiveBody(char* buffer, std::size_t size, std::size_t count, void* context) {
  auto& state = *static_cast<TransferState*>(context);
  const std::size_t length = size * count;
  state.deliverHead();
  const auto* bytes = reinterpret_cast<const std::uint8_t*>(buffer);
  if (state.options->onData) {
    if (!state.options->onData({bytes, length})) {
      state.aborted = true;
      return 0;
    }
    return length;
  }
  PlistData& body = state.result->body;
  if (body.size() + length > state.options->maximumBodySize) {
    state.tooLarge = true;
    return 0;
  }
  body.insert(body.end(), bytes, bytes + length);
  return length;
}

int reportProgress(void* context, curl_off_t expected, curl_off_t received, curl_off_t,
                   curl_off_t) {
  auto& state = *static_cast<TransferState*>(context);
  if (!state.options->onProgress) return 0;
  const auto offset = state.options->resumeFrom;
  if (state.options->onProgress(static_cast<std::uint64_t>(received) + offset,
                                expected > 0 ? static_cast<std::uint64_t>(expected) + offset : 0)) {
    return 0;
  }
  state.aborted = true;
  return 1;
}

VendError transferError(long code, std::string description) {
  VendError error;
  error.domain = std::string(VendHTTPTransfer::kErrorDomain);
  error.code = code;
  error.description = std::move(description);
  return error;
}

std::unique_ptr<curl_slist, ListDeleter> headerList(const VendURLRequest& request) {
  curl_slist* list = nullptr;
  // curl would otherwise send "Expect: 100-continue" and wait for it.
  list = curl_slist_append(list, "Expect:");
  for (const auto& [name, value] : request.headers()) {
    std::string line = name;
    line += ": ";
    line += value;
    list = curl_slist_append(list, line.c_str());
  }
  if (request.cachePolicy() == VendURLRequest::kReloadIgnoringLocalCacheData) {
    list = curl_slist_append(list, "Cache-Control: no-cache");
  }
  // A body is sent with the type its request names, or with none: curl
  // would call it a form.
  if (!request.valueForHeaderField("Content-Type")) {
    list = curl_slist_append(list, "Content-Type:");
  }
  return std::unique_ptr<curl_slist, ListDeleter>(list);
}

}  // namespace

VendHTTPTransfer::Result VendHTTPTransfer::perform(const VendURLRequest& request) {
  return perform(request, Options{});
}

VendHTTPTransfer::Result VendHTTPTransfer::perform(const VendURLRequest& request,
                                                   const Options& options) {
  initializeCurlOnce();
  Result result;
  std::unique_ptr<CURL, EasyDeleter> easy(curl_easy_init());
  if (!easy) {
    result.error = transferError(CURLE_FAILED_INIT, "the HTTP transport could not start");
    return result;
  }
  TransferState state{&options, &result};
  CURL* handle = easy.get();
  auto headers = headerList(request);
  const long stallSeconds = std::max(1L, std::lround(request.timeoutInterval()));

  curl_easy_setopt(handle, CURLOPT_URL, request.url().c_str());
  curl_easy_setopt(handle, CURLOPT_PROTOCOLS_STR, "http,https");
  curl_easy_setopt(handle, CURLOPT_REDIR_PROTOCOLS_STR, "http,https");
  curl_easy_setopt(handle, CURLOPT_FOLLOWLOCATION, 1L);
  curl_easy_setopt(handle, CURLOPT_MAXREDIRS, 5L);
  curl_easy_setopt(handle, CURLOPT_NOSIGNAL, 1L);
  curl_easy_setopt(handle, CURLOPT_ACCEPT_ENCODING, "");
  curl_easy_setopt(handle, CURLOPT_HTTPHEADER, headers.get());
  curl_easy_setopt(handle, CURLOPT_CONNECTTIMEOUT_MS,
                   static_cast<long>(options.connectTimeout.count()));
  curl_easy_setopt(handle, CURLOPT_LOW_SPEED_LIMIT, 1L);
  curl_easy_setopt(handle, CURLOPT_LOW_SPEED_TIME, stallSeconds);
  curl_easy_setopt(handle, CURLOPT_HEADERFUNCTION, receiveHeader);
  curl_easy_setopt(handle, CURLOPT_HEADERDATA, &state);
  curl_easy_setopt(handle, CURLOPT_WRITEFUNCTION, receiveBody);
  curl_easy_setopt(handle, CURLOPT_WRITEDATA, &state);
  curl_easy_setopt(handle, CURLOPT_XFERINFOFUNCTION, reportProgress);
  curl_easy_setopt(handle, CURLOPT_XFERINFODATA, &state);
  curl_easy_setopt(handle, CURLOPT_NOPROGRESS, 0L);
  curl_easy_setopt(handle, CURLOPT_BUFFERSIZE, 512L * 1024L);
  if (options.resumeFrom > 0) {
    curl_easy_setopt(handle, CURLOPT_RESUME_FROM_LARGE,
                     static_cast<curl_off_t>(options.resumeFrom));
  }
  if (request.method() == "POST") {
    curl_easy_setopt(handle, CURLOPT_POST, 1L);
    curl_easy_setopt(handle, CURLOPT_POSTFIELDSIZE_LARGE,
                     static_cast<curl_off_t>(request.body().size()));
    curl_easy_setopt(handle, CURLOPT_POSTFIELDS, request.body().data());
  } else if (request.method() != "GET") {
    curl_easy_setopt(handle, CURLOPT_CUSTOMREQUEST, request.method().c_str());
  }

  const CURLcode code = curl_easy_perform(handle);
  curl_easy_getinfo(handle, CURLINFO_RESPONSE_CODE, &result.response.statusCode);
  if (char* effective = nullptr;
      curl_easy_getinfo(handle, CURLINFO_EFFECTIVE_URL, &effective) == CURLE_OK && effective) {
    result.response.url = effective;
  }
  if (code == CURLE_OK) {
    state.deliverHead();
  } else if (state.aborted) {
    result.error = transferError(VendError::kCancelledCode, "the transfer was cancelled");
  } else if (state.tooLarge) {
    result.error = transferError(CURLE_FILESIZE_EXCEEDED, "the answer is larger than allowed");
  } else {
    result.error = transferError(code, curl_easy_strerror(code));
  }
  return result;
}

}  // namespace larder
