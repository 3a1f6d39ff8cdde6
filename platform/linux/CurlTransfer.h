// One attempt at a task: an easy handle set up for it, and what libcurl tells about it. Lives on the engine's thread.
#pragma once

#include <curl/curl.h>

#include <memory>
#include <string>

#include "platform/linux/CurlSession.h"

namespace velk {

/// Registers itself with the handle: stays where it is until the handle has left the multi handle.
class CurlTransfer {
 public:
  CurlTransfer(std::shared_ptr<CurlTask> task, CURL* easy);
  ~CurlTransfer();
  CurlTransfer(const CurlTransfer&) = delete;
  CurlTransfer& operator=(const CurlTransfer&) = delete;

  /// Sets every option. False when the library refuses one (out of memory): the request must not be made then.
  [[nodiscard]] bool configure(const HttpTrust& trust, SteadyTime now);

  [[nodiscard]] const std::shared_ptr<CurlTask>& task() const noexcept { return _task; }
  /// Nothing when the attempt succeeded; else host and cause.
  [[nodiscard]] std::optional<Error> error(CURLcode code) const;
  /// Whether it failed for want of a route, before the server had said anything.
  enum class LacksRoute { no, yes, ifThereIsNoDefaultRoute };
  [[nodiscard]] LacksRoute lacksRoute(CURLcode code) const;

 private:
  template <class Value>
  void set(CURLoption option, Value value) {
    if (curl_easy_setopt(_easy, option, value) != CURLE_OK) _configured = false;
  }
  void configureConnection(const HttpTrust& trust, SteadyTime now);
  void configureCallbacks();
  void configureBody();
  void configureHeaders();
  void addHeader(const std::string& line);

  static std::size_t onHeader(char* data, std::size_t size, std::size_t count, void* self);
  static std::size_t onData(char* data, std::size_t size, std::size_t count, void* self);
  static std::size_t onRead(char* buffer, std::size_t size, std::size_t count, void* self);
  static int onSeek(void* self, curl_off_t offset, int origin);
  static int onProgress(void* self, curl_off_t, curl_off_t, curl_off_t toSend, curl_off_t sent);
  static curl_socket_t onOpenSocket(void* self, curlsocktype purpose, curl_sockaddr* address);
  static int onSocket(void* self, curl_socket_t socket, curlsocktype purpose);

  std::size_t headerReceived(std::string_view line);
  void headEnded();
  std::size_t dataReceived(std::span<const std::uint8_t> data);
  std::size_t refuse(CURLcode code, const char* why);

  const std::shared_ptr<CurlTask> _task;
  CURL* const _easy;
  curl_slist* _headers = nullptr;
  bool _configured = true;
  char _errorText[CURL_ERROR_SIZE] = {};
  HttpResponse _response;
  bool _announced = false;
  std::size_t _headBytes = 0;
  std::size_t _bodyBytes = 0;
  curl_off_t _bodyFileOffset = 0;
  curl_off_t _reportedSent = 0;
  /// The errno of a socket that the system had none left for, or 0.
  int _socketError = 0;
  /// Why we ended it ourselves.
  std::optional<Error> _refusal;
};

}  // namespace velk
