#include "forwarder/CurlTransport.h"

#include <curl/curl.h>

#include <algorithm>
#include <array>
#include <cctype>
#include <cstdlib>
#include <string_view>

namespace ostrel {
namespace {

constexpr std::size_t kNothing = 0;  // Taken of what curl offers: ends the request.

std::size_t takeBody(char* bytes, std::size_t, std::size_t size, void* target) {
  Reply& reply = *static_cast<Reply*>(target);
  const std::size_t room = Transport::kMostReplyBytes - reply.body.size();
  reply.body.append(bytes, std::min(size, room));
  return size <= room ? size : kNothing;
}

bool isName(std::string_view text, std::string_view lowerName) {
  return std::equal(text.begin(), text.end(), lowerName.begin(), lowerName.end(),
                    [](char each, char lower) {
                      return std::tolower(static_cast<unsigned char>(each)) == lower;
                    });
}

std::size_t takeHeader(char* bytes, std::size_t, std::size_t size, void* target) {
  constexpr std::string_view kBlanks = " \t\r\n";
  Reply& reply = *static_cast<Reply*>(target);
  const std::string_view line(bytes, size);
  const std::size_t colon = line.find(':');
  if (colon == std::string_view::npos) return size;
  if (!isName(line.substr(0, colon), "retry-after")) return size;
  std::string_view value = line.substr(colon + 1);
  value.remove_prefix(std::min(value.find_first_not_of(kBlanks), value.size()));
  value = value.substr(0, value.find_last_not_of(kBlanks) + 1);
  reply.retryAfter = value;
  return size;
}

}  // namespace

/// What libcurl gave out.
class CurlTransport::Handles {
 public:
  explicit Handles(const ForwarderSettings& settings) {
    if (::curl_global_init(CURL_GLOBAL_DEFAULT) != CURLE_OK) std::abort();
    multi_ = ::curl_multi_init();
    request_ = ::curl_easy_init();
    if (multi_ == nullptr || request_ == nullptr) std::abort();
    addHeader("Content-Type: application/json");
    // The body goes with the head; nobody waits to be asked for it.
    addHeader("Expect:");
    for (const auto& [name, value] : settings.headers) {
      // A name that ends in ";" is sent with an empty value.
      addHeader(std::string(name).append(value.empty() ? ";" : ": ").append(value));
    }
    setUp(settings);
    setUpTLS(settings);
  }
  ~Handles() {
    ::curl_easy_cleanup(request_);
    ::curl_multi_cleanup(multi_);
    ::curl_slist_free_all(headers_);
    ::curl_global_cleanup();
  }
  Handles(const Handles&) = delete;
  Handles& operator=(const Handles&) = delete;

  /// False when it was interrupted.
  bool perform(const std::string& body, int end, Reply& reply) {
    failure_[0] = '\0';
    ::curl_easy_setopt(request_, CURLOPT_POSTFIELDS, body.data());
    ::curl_easy_setopt(request_, CURLOPT_POSTFIELDSIZE_LARGE,
                       static_cast<curl_off_t>(body.size()));
    ::curl_easy_setopt(request_, CURLOPT_WRITEDATA, &reply);
    ::curl_easy_setopt(request_, CURLOPT_HEADERDATA, &reply);
    ::curl_multi_add_handle(multi_, request_);
    const bool isDone = waitForEnd(end);
    const CURLcode code = result();
    ::curl_multi_remove_handle(multi_, request_);
    long status = 0;
    ::curl_easy_getinfo(request_, CURLINFO_RESPONSE_CODE, &status);
    reply.status = static_cast<int>(status);
    if (status == 0) {
      reply.failure = failure_[0] != '\0' ? failure_.data() : ::curl_easy_strerror(code);
    }
    return isDone;
  }

 private:
  void addHeader(const std::string& line) {
    headers_ = ::curl_slist_append(headers_, line.c_str());
  }

  template <typename T>
  void set(CURLoption option, T value) {
    if (::curl_easy_setopt(request_, option, value) != CURLE_OK) std::abort();
  }

  void setUp(const ForwarderSettings& settings) {
    const auto milliseconds = static_cast<long>(settings.timeout.count());
    const auto connecting = static_cast<long>(kConnectTimeout.count());
    set(CURLOPT_URL, settings.logs.url.c_str());
    set(CURLOPT_POST, 1L);
    set(CURLOPT_HTTPHEADER, headers_);
    set(CURLOPT_USERAGENT, "ostrelforwarder/" OSTREL_VERSION);
    set(CURLOPT_HTTP_VERSION, static_cast<long>(CURL_HTTP_VERSION_1_1));
    set(CURLOPT_FOLLOWLOCATION, 0L);
    set(CURLOPT_NOSIGNAL, 1L);
    // A look-up of a name that hangs is left behind.
    set(CURLOPT_QUICK_EXIT, 1L);
    set(CURLOPT_CONNECTTIMEOUT_MS, std::min(connecting, milliseconds));
    set(CURLOPT_TIMEOUT_MS, milliseconds);
    set(CURLOPT_WRITEFUNCTION, takeBody);
    set(CURLOPT_HEADERFUNCTION, takeHeader);
    set(CURLOPT_ERRORBUFFER, failure_.data());
    // Through a proxy a request would leave the machine as it is.
    if (!settings.logs.isSecure) set(CURLOPT_PROXY, "");
  }

  void setUpTLS(const ForwarderSettings& settings) {
    set(CURLOPT_PROTOCOLS_STR, settings.logs.isSecure ? "https" : "http");
    set(CURLOPT_SSL_VERIFYPEER, 1L);
    set(CURLOPT_SSL_VERIFYHOST, 2L);
    set(CURLOPT_SSLVERSION, static_cast<long>(CURL_SSLVERSION_TLSv1_2));
    if (!settings.authoritiesFile.empty()) {
      set(CURLOPT_CAINFO, settings.authoritiesFile.c_str());
      set(CURLOPT_CAPATH, static_cast<const char*>(nullptr));
    }
    if (!settings.certificateFile.empty()) {
      set(CURLOPT_SSLCERT, settings.certificateFile.c_str());
    }
    if (!settings.keyFile.empty()) set(CURLOPT_SSLKEY, settings.keyFile.c_str());
  }

  // False when `end` became readable first.
  bool waitForEnd(int end) {
    constexpr int kMostMilliseconds = 60'000;  // curl shortens it to its own deadlines.
    for (;;) {
      int running = 0;
      curl_waitfd descriptor{end, CURL_WAIT_POLLIN, 0};
      ::curl_multi_poll(multi_, &descriptor, 1, /*timeout_ms=*/0, nullptr);
      if (descriptor.revents != 0) return false;
      ::curl_multi_perform(multi_, &running);
      if (running == 0) return true;
      ::curl_multi_poll(multi_, &descriptor, 1, kMostMilliseconds, nullptr);
    }
  }

  CURLcode result() {
    int left = 0;
    const CURLMsg* message = ::curl_multi_info_read(multi_, &left);
    return message != nullptr ? message->data.result : CURLE_OK;
  }

  CURLM* multi_ = nullptr;
  CURL* request_ = nullptr;
  curl_slist* headers_ = nullptr;
  std::array<char, CURL_ERROR_SIZE> failure_{};
};

CurlTransport::CurlTransport(const ForwarderSettings& settings, int end)
    : end_(end), handles_(std::make_unique<Handles>(settings)) {}

CurlTransport::~CurlTransport() = default;

Reply CurlTransport::post(const std::string& body) {
  Reply reply;
  reply.isInterrupted = !handles_->perform(body, end_, reply);
  return reply;
}

}  // namespace ostrel
