// One request with libcurl.
//
// One handle serves all requests, because it keeps the connection: a TLS handshake costs more than
// a batch. Redirects are not followed, because a redirect could send events and credentials to a
// host that nobody configured.

#include "forwarder/Collector.h"

#include <curl/curl.h>
#include <zlib.h>

#include <algorithm>

#include "platform/Text.h"

namespace tessel {

namespace {

// The fastest level makes a body of records a tenth as long. Slower ones gain little more.
constexpr int kCompressionLevel = 1;
constexpr int kGzipWindow = 15 + 16;  // zlib: the largest window, and 16 asks for a gzip header

struct Reading {
  std::string body;
  bool tooLong = false;
  bool headEnded = false;
};

// Answering less than `count` makes libcurl end the transfer.
size_t takeBody(char* bytes, size_t /*one*/, size_t count, void* target) {
  auto& reading = *static_cast<Reading*>(target);
  const size_t room = Collector::kMaxAnswerBytes - reading.body.size();
  reading.tooLong = count > room;
  reading.body.append(bytes, std::min(count, room));
  return reading.tooLong ? 0 : count;
}

// libcurl takes a head that breaks off for a whole one. Only an empty line ends a head. An interim
// answer has a head of its own, so each status line begins anew.
size_t takeHeadLine(char* bytes, size_t /*one*/, size_t count, void* target) {
  const std::string_view line(bytes, count);
  static_cast<Reading*>(target)->headEnded = line == "\r\n" || line == "\n";
  return count;
}

// "Application/JSON; charset=utf-8" becomes "application/json".
std::string mediaTypeOf(CURL* request) {
  const char* header = nullptr;
  if (curl_easy_getinfo(request, CURLINFO_CONTENT_TYPE, &header) != CURLE_OK || header == nullptr)
    return {};
  std::string type(trimmed(std::string_view(header).substr(0, std::string_view(header).find(';'))));
  std::transform(type.begin(), type.end(), type.begin(), [](char letter) {
    return letter >= 'A' && letter <= 'Z' ? static_cast<char>(letter - 'A' + 'a') : letter;
  });
  return type;
}

// libcurl calls this about once a second while it waits, and ends the request if the answer is not
// 0.
int checkCancelled(void* flag, curl_off_t, curl_off_t, curl_off_t, curl_off_t) {
  return static_cast<const std::atomic<bool>*>(flag)->load() ? 1 : 0;
}

// A gzip stream for one body after another, because its state of 256 KiB is costly to set up.
class Gzip {
 public:
  Gzip() {
    good_ = deflateInit2(&stream_, kCompressionLevel, Z_DEFLATED, kGzipWindow, 8,
                         Z_DEFAULT_STRATEGY) == Z_OK;
  }
  Gzip(const Gzip&) = delete;
  Gzip& operator=(const Gzip&) = delete;
  ~Gzip() { deflateEnd(&stream_); }

  bool compress(std::string_view text, std::string& out) {
    if (!good_ || deflateReset(&stream_) != Z_OK) return false;
    out.resize(deflateBound(&stream_, text.size()));
    // zlib's interface has no const here, but it does not write to its input.
    stream_.next_in = reinterpret_cast<Bytef*>(const_cast<char*>(text.data()));
    stream_.avail_in = static_cast<uInt>(text.size());
    stream_.next_out = reinterpret_cast<Bytef*>(out.data());
    stream_.avail_out = static_cast<uInt>(out.size());
    const bool done = deflate(&stream_, Z_FINISH) == Z_STREAM_END;
    out.resize(stream_.total_out);
    return done;
  }

 private:
  z_stream stream_{};
  bool good_ = false;
};

}  // namespace

struct CurlCollector::Handles {
  CURL* request = curl_easy_init();
  curl_slist* headers = nullptr;
  Gzip gzip;
  std::string compressed;
  char reason[CURL_ERROR_SIZE] = "";

  Handles() = default;
  Handles(const Handles&) = delete;
  Handles& operator=(const Handles&) = delete;
  ~Handles() {
    curl_easy_cleanup(request);
    curl_slist_free_all(headers);
  }

  template <typename Value>
  void set(CURLoption option, Value value) {
    curl_easy_setopt(request, option, value);
  }
  void setFile(CURLoption option, const std::string& path) {
    if (!path.empty()) set(option, path.c_str());
  }
  void setHeaders(const ForwarderSettings& settings, std::string_view contentType) {
    headers = curl_slist_append(headers, ("Content-Type: " + std::string(contentType)).c_str());
    // Without this, libcurl would ask before each large body whether it may send it, and wait.
    headers = curl_slist_append(headers, "Expect:");
    if (settings.compress) headers = curl_slist_append(headers, "Content-Encoding: gzip");
    for (const std::string& header : settings.headers)
      headers = curl_slist_append(headers, header.c_str());
    set(CURLOPT_HTTPHEADER, headers);
  }
};

CurlCollector::CurlCollector(const ForwarderSettings& settings, std::string_view contentType)
    : compress_(settings.compress), handles_(std::make_unique<Handles>()) {
  Handles& to = *handles_;
  to.set(CURLOPT_URL, settings.url.c_str());
  to.set(CURLOPT_PROTOCOLS_STR, "http,https");
  to.set(CURLOPT_FOLLOWLOCATION, 0L);
  to.set(CURLOPT_TIMEOUT_MS, static_cast<long>(settings.timeout.count()));
  // Signals belong to the signal thread; libcurl would use SIGALRM for its timeout.
  to.set(CURLOPT_NOSIGNAL, 1L);
  to.set(CURLOPT_USERAGENT, "statora_forwarder/" TESSEL_VERSION);
  to.set(CURLOPT_POST, 1L);
  to.set(CURLOPT_WRITEFUNCTION, &takeBody);
  to.set(CURLOPT_HEADERFUNCTION, &takeHeadLine);
  to.set(CURLOPT_SUPPRESS_CONNECT_HEADERS, 1L);
  to.set(CURLOPT_ERRORBUFFER, to.reason);
  to.set(CURLOPT_NOPROGRESS, 0L);
  to.set(CURLOPT_XFERINFOFUNCTION, &checkCancelled);
  to.set(CURLOPT_XFERINFODATA, &cancelled_);
  to.setFile(CURLOPT_CAINFO, settings.authorities);
  to.setFile(CURLOPT_SSLCERT, settings.clientCertificate);
  to.setFile(CURLOPT_SSLKEY, settings.clientKey);
  to.setHeaders(settings, contentType);
}

CurlCollector::~CurlCollector() = default;

CollectorAnswer CurlCollector::post(std::string_view body) {
  Handles& with = *handles_;
  CollectorAnswer answer;
  std::string_view sent = body;
  if (compress_) {
    if (!with.gzip.compress(body, with.compressed)) {
      answer.error = "the body cannot be compressed";
      return answer;
    }
    sent = with.compressed;
  }
  Reading reading;
  with.reason[0] = '\0';
  with.set(CURLOPT_POSTFIELDS, sent.data());
  with.set(CURLOPT_POSTFIELDSIZE_LARGE, static_cast<curl_off_t>(sent.size()));
  with.set(CURLOPT_WRITEDATA, &reading);
  with.set(CURLOPT_HEADERDATA, &reading);
  const CURLcode result = curl_easy_perform(with.request);

  answer.bytesSent = sent.size();
  if (result == CURLE_OK && !reading.headEnded) {
    answer.error = "the head of the answer breaks off";
    return answer;
  }
  // Of a failure the status is enough, however long its body.
  long status = 0;
  curl_easy_getinfo(with.request, CURLINFO_RESPONSE_CODE, &status);
  if (result != CURLE_OK && !(reading.tooLong && status >= 300)) {
    answer.error = with.reason[0] != '\0' ? with.reason : curl_easy_strerror(result);
    return answer;
  }
  answer.status = status;
  answer.mediaType = mediaTypeOf(with.request);
  answer.body = std::move(reading.body);
  curl_off_t seconds = 0;
  if (curl_easy_getinfo(with.request, CURLINFO_RETRY_AFTER, &seconds) == CURLE_OK && seconds > 0) {
    answer.retryAfter = std::chrono::seconds{seconds};
  }
  return answer;
}

}  // namespace tessel
