#include "store-runtime/http/VendHTTPTransfer.h"

#include <algorithm>
#include <cctype>
#include <cmath>
#include <memory>
#include <mutex>

#include "store-runtime/http/CurlLibrary.h"
#include "store-runtime/http/VendRequestSigner.h"

namespace larder {
namespace {

// The loaded library. Both entry points, `perform` and `redirectPolicy`,
// make sure it loaded before anything below runs.
const CurlLibrary& curl() {
  return **CurlLibrary::shared();
}

struct EasyDeleter {
  void operator()(CURL* handle) const { curl().easyCleanup(handle); }
};
struct ListDeleter {
  void operator()(curl_slist* list) const { curl().slistFreeAll(list); }
};
struct URLDeleter {
  void operator()(CURLU* url) const { curl().urlCleanup(url); }
};

// What the callbacks share while one transfer runs.
struct TransferState {
  const VendHTTPTransfer::Options* options = nullptr;
  VendHTTPTransfer::Result* result = nullptr;
  std::chrono::steady_clock::time_point started;
  double stallSeconds = 0;
  bool headDelivered = false;
  bool aborted = false;
  bool tooLarge = false;
  bool overTime = false;
  bool locationSeen = false;

  // A redirect's head and body are not the answer; they stay here.
  [[nodiscard]] bool isRedirect() const {
    const long status = result->response.statusCode;
    return locationSeen && status >= 300 && status < 400;
  }

  void deliverHead() {
    if (headDelivered || isRedirect()) return;
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
    state.locationSeen = false;
    return line.size();
  }
  const auto colon = line.find(':');
  if (colon != std::string_view::npos) {
    std::string name = trimmed(line.substr(0, colon));
    std::string lowered = name;
    std::ranges::transform(lowered, lowered.begin(),
                           [](unsigned char c) { return std::tolower(c); });
    if (lowered == "location") state.locationSeen = true;
    state.result->response.headers.emplace_back(std::move(name), trimmed(line.substr(colon + 1)));
  }
  return line.size();
}

std::size_t receiveBody(char* buffer, std::size_t size, std::size_t count, void* context) {
  auto& state = *static_cast<TransferState*>(context);
  const std::size_t length = size * count;
  if (state.isRedirect()) return length;
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

int reportProgress(void* context, curl_off_t expected, curl_off_t received, curl_off_t toSend,
                   curl_off_t sent) {
  auto& state = *static_cast<TransferState*>(context);
  const auto bytes = static_cast<std::uint64_t>(std::max({expected, received, toSend, sent}));
  if (std::chrono::steady_clock::now() - state.started >
      VendHTTPTransfer::totalTimeBound(state.stallSeconds, bytes)) {
    state.overTime = true;
    return 1;
  }
  if (!state.options->onProgress || state.isRedirect()) return 0;
  const auto offset = state.options->resumeFrom;
  if (state.options->onProgress(static_cast<std::uint64_t>(received) + offset,
                                expected > 0 ? static_cast<std::uint64_t>(expected) + offset : 0)) {
    return 0;
  }
  state.aborted = true;
  return 1;
}

// The query may carry an account's tokens; errors travel to clients and logs.
std::string withoutQuery(const std::string& url) {
  return url.substr(0, url.find_first_of("?#"));
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
  list = curl().slistAppend(list, "Expect:");
  for (const auto& [name, value] : request.headers()) {
    std::string line = name;
    line += ": ";
    line += value;
    list = curl().slistAppend(list, line.c_str());
  }
  if (request.cachePolicy() == VendURLRequest::kReloadIgnoringLocalCacheData) {
    list = curl().slistAppend(list, "Cache-Control: no-cache");
  }
  // A body is sent with the type its request names, or with none: curl
  // would call it a form.
  if (!request.valueForHeaderField("Content-Type")) {
    list = curl().slistAppend(list, "Content-Type:");
  }
  return std::unique_ptr<curl_slist, ListDeleter>(list);
}

}  // namespace

namespace {

// Parts of a URL that decide where it goes; nullopt for a URL that does
// not parse.
struct Origin {
  std::string scheme;
  std::string host;
  std::string port;
  bool operator==(const Origin&) const = default;
};

std::optional<Origin> originOf(std::string_view url) {
  std::unique_ptr<CURLU, URLDeleter> parsed(curl().url());
  if (!parsed) return std::nullopt;
  const std::string text(url);
  if (curl().urlSet(parsed.get(), CURLUPART_URL, text.c_str(), 0) != CURLUE_OK) return std::nullopt;
  const auto part = [&](CURLUPart which, unsigned int flags) -> std::optional<std::string> {
    char* value = nullptr;
    if (curl().urlGet(parsed.get(), which, &value, flags) != CURLUE_OK || !value)
      return std::nullopt;
    std::string copy(value);
    curl().free(value);
    return copy;
  };
  auto scheme = part(CURLUPART_SCHEME, 0);
  auto host = part(CURLUPART_HOST, 0);
  auto port = part(CURLUPART_PORT, CURLU_DEFAULT_PORT);
  if (!scheme || !host || !port) return std::nullopt;
  std::ranges::transform(*scheme, scheme->begin(), [](unsigned char c) { return std::tolower(c); });
  std::ranges::transform(*host, host->begin(), [](unsigned char c) { return std::tolower(c); });
  return Origin{std::move(*scheme), std::move(*host), std::move(*port)};
}

// One exchange without following redirects; `redirectURL` gets the
// Location of a redirect answer, resolved against the request's URL.
VendHTTPTransfer::Result performOnce(const VendURLRequest& request,
                                     const VendHTTPTransfer::Options& options,
                                     std::chrono::steady_clock::time_point started,
                                     std::string& redirectURL) {
  using Result = VendHTTPTransfer::Result;
  Result result;
  std::unique_ptr<CURL, EasyDeleter> easy(curl().easyInit());
  if (!easy) {
    result.error = transferError(CURLE_FAILED_INIT, "the HTTP transport could not start");
    return result;
  }
  const long stallSeconds = std::max(1L, std::lround(request.timeoutInterval()));
  TransferState state{&options, &result, started, static_cast<double>(stallSeconds)};
  CURL* handle = easy.get();
  auto headers = headerList(request);

  curl().easySetopt(handle, CURLOPT_URL, request.url().c_str());
  curl().easySetopt(handle, CURLOPT_PROTOCOLS_STR, "http,https");
  // Redirects are followed by `perform`, which decides what goes along.
  curl().easySetopt(handle, CURLOPT_FOLLOWLOCATION, 0L);
  curl().easySetopt(handle, CURLOPT_NOSIGNAL, 1L);
  curl().easySetopt(handle, CURLOPT_ACCEPT_ENCODING, "");
  curl().easySetopt(handle, CURLOPT_HTTPHEADER, headers.get());
  curl().easySetopt(handle, CURLOPT_CONNECTTIMEOUT_MS,
                    static_cast<long>(options.connectTimeout.count()));
  curl().easySetopt(handle, CURLOPT_LOW_SPEED_LIMIT, 1L);
  curl().easySetopt(handle, CURLOPT_LOW_SPEED_TIME, stallSeconds);
  curl().easySetopt(handle, CURLOPT_HEADERFUNCTION, receiveHeader);
  curl().easySetopt(handle, CURLOPT_HEADERDATA, &state);
  curl().easySetopt(handle, CURLOPT_WRITEFUNCTION, receiveBody);
  curl().easySetopt(handle, CURLOPT_WRITEDATA, &state);
  curl().easySetopt(handle, CURLOPT_XFERINFOFUNCTION, reportProgress);
  curl().easySetopt(handle, CURLOPT_XFERINFODATA, &state);
  curl().easySetopt(handle, CURLOPT_NOPROGRESS, 0L);
  curl().easySetopt(handle, CURLOPT_BUFFERSIZE, 512L * 1024L);
  if (options.resumeFrom > 0) {
    curl().easySetopt(handle, CURLOPT_RESUME_FROM_LARGE,
                      static_cast<curl_off_t>(options.resumeFrom));
  }
  if (request.method() == "POST") {
    curl().easySetopt(handle, CURLOPT_POST, 1L);
    curl().easySetopt(handle, CURLOPT_POSTFIELDSIZE_LARGE,
                      static_cast<curl_off_t>(request.body().size()));
    curl().easySetopt(handle, CURLOPT_POSTFIELDS, request.body().data());
  } else if (request.method() != "GET") {
    curl().easySetopt(handle, CURLOPT_CUSTOMREQUEST, request.method().c_str());
  }

  const CURLcode code = curl().easyPerform(handle);
  curl().easyGetinfo(handle, CURLINFO_RESPONSE_CODE, &result.response.statusCode);
  if (char* effective = nullptr;
      curl().easyGetinfo(handle, CURLINFO_EFFECTIVE_URL, &effective) == CURLE_OK && effective) {
    result.response.url = effective;
  }
  if (code == CURLE_OK && state.isRedirect()) {
    if (char* location = nullptr;
        curl().easyGetinfo(handle, CURLINFO_REDIRECT_URL, &location) == CURLE_OK && location) {
      redirectURL = location;
    }
  }
  if (code == CURLE_OK) {
    state.deliverHead();
  } else if (state.overTime) {
    const auto bound = std::chrono::duration_cast<std::chrono::seconds>(
        VendHTTPTransfer::totalTimeBound(state.stallSeconds, 0));
    result.error =
        transferError(CURLE_OPERATION_TIMEDOUT,
                      "the transfer took longer than its time bound (" +
                          std::to_string(bound.count()) + " s plus its size at " +
                          std::to_string(VendHTTPTransfer::kMinimumRate / 1024) + " KiB/s)");
  } else if (state.aborted) {
    result.error = transferError(VendError::kCancelledCode, "the transfer was cancelled");
  } else if (state.tooLarge) {
    result.error = transferError(CURLE_FILESIZE_EXCEEDED, "the answer is larger than allowed");
  } else {
    result.error = transferError(code, curl().easyStrerror(code));
  }
  // Which server, for the person who reads the error far from this log.
  if (result.error) result.error->description += " (" + withoutQuery(request.url()) + ")";
  return result;
}

}  // namespace

VendHTTPTransfer::Redirect VendHTTPTransfer::redirectPolicy(std::string_view fromURL,
                                                            std::string_view toURL) {
  if (!CurlLibrary::shared()) return Redirect::kRefuse;
  const auto from = originOf(fromURL);
  const auto to = originOf(toURL);
  if (!from || !to) return Redirect::kRefuse;
  if (to->scheme != "https" && to->scheme != "http") return Redirect::kRefuse;
  if (from->scheme == "https" && to->scheme != "https") return Redirect::kRefuse;
  return *from == *to ? Redirect::kFollow : Redirect::kFollowWithoutAccount;
}

std::chrono::milliseconds VendHTTPTransfer::totalTimeBound(double stallSeconds,
                                                           std::uint64_t bytes) {
  const double seconds =
      2 * std::max(1.0, stallSeconds) + static_cast<double>(bytes) / kMinimumRate;
  return std::chrono::milliseconds(std::llround(seconds * 1000));
}

VendHTTPTransfer::Result VendHTTPTransfer::perform(const VendURLRequest& request) {
  return perform(request, Options{});
}

VendHTTPTransfer::Result VendHTTPTransfer::perform(const VendURLRequest& request,
                                                   const Options& options) {
  if (auto library = CurlLibrary::shared(); !library) {
    Result result;
    result.error = transferError(
        CURLE_FAILED_INIT, "the HTTP transport could not start: " + library.error().description);
    return result;
  }
  const auto started = std::chrono::steady_clock::now();
  VendURLRequest current = request;
  for (int redirects = 0;; ++redirects) {
    std::string next;
    Result result = performOnce(current, options, started, next);
    if (result.error || next.empty()) return result;
    const Redirect decision = redirectPolicy(current.url(), next);
    if (decision == Redirect::kRefuse || redirects == kMaximumRedirects) {
      result.error = transferError(
          decision == Redirect::kRefuse ? CURLE_UNSUPPORTED_PROTOCOL : CURLE_TOO_MANY_REDIRECTS,
          decision == Redirect::kRefuse
              ? "refused the redirect from " + current.url() + " to " + next
              : "too many redirects, the last to " + next);
      return result;
    }
    if (decision == Redirect::kFollowWithoutAccount) {
      current.setValue("", VendRequestSigner::kAccountHeader);
      current.setValue("", VendRequestSigner::kSignatureHeader);
    }
    const long status = result.response.statusCode;
    // As browsers do: 303 always, and 301 and 302 of a POST, go on as a
    // plain fetch; 307 and 308 repeat the request as it was.
    if (status == 303 || ((status == 301 || status == 302) && current.method() == "POST")) {
      current.setMethod("GET");
      current.setBody({});
      current.setValue("", "Content-Type");
    }
    current.setURL(std::move(next));
  }
}

}  // namespace larder
