// One request with libcurl.
//
// One handle serves all requests, because it keeps the connection: a TLS handshake costs more than
// a batch. Redirects are not followed, because a redirect could send events and credentials to a
// host that nobody configured.
//
// A time limit for the whole request would have to guess the speed of the line: within 10 seconds a
// line of 40 kB/s carries less than a batch, and such a machine would never deliver. So a request
// ends when no byte has moved for a while. libcurl counts a byte as sent when the kernel has taken
// it, and the kernel takes a mebibyte at once and sends it for half a minute. So we subtract what
// the kernel still holds.

#include "forwarder/Collector.h"

#include <curl/curl.h>
#include <linux/sockios.h>
#include <sys/ioctl.h>
#include <sys/socket.h>
#include <unistd.h>
#include <zlib.h>

#include <algorithm>
#include <vector>

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

// Ends a request that was cancelled or that stands still.
class Watch {
 public:
  Watch(const std::atomic<bool>& cancelled, std::chrono::milliseconds stall)
      : cancelled_(cancelled), stall_(stall) {}

  void begin() {
    stalled_ = false;
    moved_ = -1;
  }
  bool stalled() const { return stalled_; }

  // libcurl calls this about once a second while it waits, and ends the request if the answer is
  // not 0.
  static int progress(void* self, curl_off_t, curl_off_t received, curl_off_t, curl_off_t sent) {
    return static_cast<Watch*>(self)->goesOn(received + sent) ? 0 : 1;
  }
  static curl_socket_t openSocket(void* self, curlsocktype, curl_sockaddr* address) {
    const int made = ::socket(address->family, address->socktype | SOCK_CLOEXEC, address->protocol);
    if (made >= 0) static_cast<Watch*>(self)->sockets_.push_back(made);
    return made;
  }
  static int closeSocket(void* self, curl_socket_t socket) {
    std::erase(static_cast<Watch*>(self)->sockets_, socket);
    return ::close(socket);
  }

 private:
  bool goesOn(curl_off_t bytes) {
    for (const int socket : sockets_) {
      int queued = 0;
      if (::ioctl(socket, SIOCOUTQ, &queued) == 0) bytes -= queued;
    }
    const auto now = std::chrono::steady_clock::now();
    if (bytes != moved_) lastMove_ = now;
    moved_ = bytes;
    stalled_ = stall_.count() > 0 && now - lastMove_ >= stall_;
    return !cancelled_ && !stalled_;
  }

  const std::atomic<bool>& cancelled_;
  const std::chrono::milliseconds stall_;
  std::vector<int> sockets_;
  curl_off_t moved_ = -1;
  std::chrono::steady_clock::time_point lastMove_;
  bool stalled_ = false;
};

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
  Watch watch;
  Gzip gzip;
  std::string compressed;
  char reason[CURL_ERROR_SIZE] = "";

  Handles(const std::atomic<bool>& cancelled, std::chrono::milliseconds stall)
      : watch(cancelled, stall) {}
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
  void setHeaders(const std::vector<std::string>& lines) {
    for (const std::string& line : lines) headers = curl_slist_append(headers, line.c_str());
    set(CURLOPT_HTTPHEADER, headers);
  }
  void setWatch() {
    set(CURLOPT_NOPROGRESS, 0L);
    set(CURLOPT_XFERINFOFUNCTION, &Watch::progress);
    set(CURLOPT_XFERINFODATA, &watch);
    set(CURLOPT_OPENSOCKETFUNCTION, &Watch::openSocket);
    set(CURLOPT_OPENSOCKETDATA, &watch);
    set(CURLOPT_CLOSESOCKETFUNCTION, &Watch::closeSocket);
    set(CURLOPT_CLOSESOCKETDATA, &watch);
  }
};

CurlCollector::CurlCollector(const ForwarderSettings& settings, std::string_view contentType)
    : settings_(settings), contentType_(contentType) {}

CurlCollector::~CurlCollector() = default;

bool CurlCollector::hasNewCredentials() const {
  return credentialsSeen_ != credentialsMark(settings_);
}

// A new handle for new credentials: libcurl keeps certificates and connections with the old one.
// False if the credentials make no sense.
bool CurlCollector::prepare() {
  std::string mark = credentialsMark(settings_);
  if (handles_ && mark == credentialsSeen_) return true;
  handles_.reset();
  const auto credentials = readCredentials(settings_);
  if (!credentials) return false;
  credentialsSeen_ = std::move(mark);
  handles_ = std::make_unique<Handles>(cancelled_, settings_.stall);
  Handles& to = *handles_;
  to.set(CURLOPT_URL, settings_.url.c_str());
  to.set(CURLOPT_PROTOCOLS_STR, "http,https");
  to.set(CURLOPT_FOLLOWLOCATION, 0L);
  to.set(CURLOPT_TIMEOUT_MS, static_cast<long>(settings_.timeout.count()));
  // A proxy cannot reach what listens on this machine alone, and would see plain http.
  if (settings_.loopback) to.set(CURLOPT_NOPROXY, "*");
  // Signals belong to the signal thread; libcurl would use SIGALRM for its timeout.
  to.set(CURLOPT_NOSIGNAL, 1L);
  to.set(CURLOPT_USERAGENT, "statora_forwarder/" TESSEL_VERSION);
  to.set(CURLOPT_POST, 1L);
  to.set(CURLOPT_WRITEFUNCTION, &takeBody);
  to.set(CURLOPT_HEADERFUNCTION, &takeHeadLine);
  to.set(CURLOPT_SUPPRESS_CONNECT_HEADERS, 1L);
  to.set(CURLOPT_ERRORBUFFER, to.reason);
  to.setWatch();
  to.setFile(CURLOPT_CAINFO, credentials->authorities);
  to.setFile(CURLOPT_SSLCERT, credentials->clientCertificate);
  to.setFile(CURLOPT_SSLKEY, credentials->clientKey);
  to.setHeaders(requestHeaders(settings_, *credentials, contentType_));
  return true;
}

CollectorAnswer CurlCollector::post(std::string_view body) {
  CollectorAnswer answer;
  if (!prepare()) {
    answer.error = "otlp-headers in CREDENTIALS_DIRECTORY is not name=value,name=value";
    return answer;
  }
  Handles& with = *handles_;
  std::string_view sent = body;
  if (settings_.compress) {
    if (!with.gzip.compress(body, with.compressed)) {
      answer.error = "the body cannot be compressed";
      return answer;
    }
    sent = with.compressed;
  }
  Reading reading;
  with.reason[0] = '\0';
  with.watch.begin();
  with.set(CURLOPT_POSTFIELDS, sent.data());
  with.set(CURLOPT_POSTFIELDSIZE_LARGE, static_cast<curl_off_t>(sent.size()));
  with.set(CURLOPT_WRITEDATA, &reading);
  with.set(CURLOPT_HEADERDATA, &reading);
  const CURLcode result = curl_easy_perform(with.request);
  answer.bytesSent = sent.size();
  long status = 0;
  curl_easy_getinfo(with.request, CURLINFO_RESPONSE_CODE, &status);
  // Of a failure the status is enough, however long its body.
  const bool enough = reading.headEnded && reading.tooLong && status >= 300;
  if ((result != CURLE_OK && !enough) || !reading.headEnded) {
    curl_off_t uploaded = 0;
    curl_easy_getinfo(with.request, CURLINFO_SIZE_UPLOAD_T, &uploaded);
    answer.brokeWhileSending = uploaded > 0;
    answer.error = with.watch.stalled()     ? "no byte has moved for too long"
                   : with.reason[0] != '\0' ? with.reason
                   : result == CURLE_OK     ? "the head of the answer breaks off"
                                            : curl_easy_strerror(result);
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
