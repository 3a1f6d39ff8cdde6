#include "tools/collector/Collector.h"

#include <chrono>

#include "tools/JsonLines.h"
#include "tools/collector/DigestKey.h"
#include "tools/collector/HttpDate.h"

namespace velk::collector {
namespace {

Answer sentence(int status, const std::string& text) {
  return {status, tools::jsonText({{"error", text}}) + "\n", "application/json", {}};
}

}  // namespace

Collector::Collector(const CollectorOptions& options, PostStore* store, Announcer& announcer, const Clock& clock)
    : _options(options), _storebags(options.storebagDirectory), _store(store), _announcer(announcer), _clock(clock) {}

Answer Collector::storebag(const std::string& name, const std::string* ifModifiedSince) {
  waitForDelay();
  const Answer answer = _options.storebagStatus
                            ? sentence(*_options.storebagStatus, "this collector was told to answer so")
                            : storebagFile(name, ifModifiedSince);
  {
    Guard guard(_lock);
    ++_totals.storebags;
  }
  _announcer.storebag(name, answer.status);
  return answer;
}

Answer Collector::storebagFile(const std::string& name, const std::string* ifModifiedSince) const {
  Result<StorebagFile> file = _storebags.find(name);
  if (!file) return sentence(404, file.error().description);
  Answer answer;
  answer.contentType = "application/octet-stream";
  answer.headers = {{"Cache-Control", "max-age=" + std::to_string(_options.maxAgeSeconds)},
                    {"Last-Modified", httpDate(file->modified)}};
  const auto since = ifModifiedSince != nullptr ? secondsFromHttpDate(*ifModifiedSince) : std::nullopt;
  if (since && file->modified <= *since) {
    answer.status = 304;
  } else {
    answer.body.assign(file->envelope.begin(), file->envelope.end());
  }
  return answer;
}

Result<std::string> Collector::checkedBody(const HeaderList& headers, std::string_view wire) const {
  Result<std::string> body = plainBody(wire, headers, _bounds);
  if (!body || !_options.digestKey) return body;
  const Result<void> checked = checkDigest(*_options.digestKey, *body, headerValue(headers, "X-Velk-DIGEST"));
  if (!checked) return Failure(checked.error());
  return body;
}

Answer Collector::post(const std::string& path, const HeaderList& headers, std::string_view wire) {
  if (_options.postStatus && *_options.postStatus != 200) {
    return refuse(path, *_options.postStatus, "this collector was told to answer so");
  }
  const Result<std::string> body = checkedBody(headers, wire);
  if (!body) return refuse(path, 400, body.error().description);
  if (_options.sink) return sinkPost(*body, wire.size());

  Result<ReceivedPost> post = readPost(*body);
  if (!post) return refuse(path, 400, post.error().description);
  post->wireBytes = wire.size();
  post->bodyBytes = body->size();
  const Result<std::int64_t> number = keep(*post, path, headers);
  if (!number) {
    // Senders are not told where things stand on this machine.
    (void)refuse(path, 500, number.error().description);
    return sentence(500, "the post cannot be kept");
  }
  _announcer.post(*number, path, *post, _options.digestKey.has_value());
  return {200, "{}", "application/json", {}};
}

Answer Collector::sinkPost(const std::string& body, std::size_t wireBytes) {
  count(countEvents(body), body.size(), wireBytes);
  return {200, "{}", "application/json", {}};
}

Result<std::int64_t> Collector::keep(const ReceivedPost& post, const std::string& path, const HeaderList& headers) {
  Result<std::int64_t> number = 0;
  if (_store != nullptr) number = _store->add(post, path, headers, _clock.wallTime());
  if (!number) return number;
  const std::uint64_t counted = count(post.events.size(), post.bodyBytes, post.wireBytes);
  if (_store == nullptr) number = static_cast<std::int64_t>(counted);
  return number;
}

std::uint64_t Collector::count(std::size_t events, std::size_t bytes, std::size_t wireBytes) {
  Guard guard(_lock);
  _totals.events += events;
  _totals.bytes += bytes;
  _totals.wireBytes += wireBytes;
  return ++_totals.posts;
}

Answer Collector::unreadablePost(const std::string& path) {
  return refuse(path, 400, "the body did not come whole, or is larger than is taken");
}

Answer Collector::refuse(const std::string& path, int status, const std::string& reason) {
  {
    Guard guard(_lock);
    ++_totals.refused;
  }
  _announcer.refused(path, status, reason);
  return sentence(status, reason);
}

Totals Collector::totals() {
  Guard guard(_lock);
  return _totals;
}

Answer Collector::stats() { return {200, tools::jsonText(dictionaryOf(totals())) + "\n", "application/json", {}}; }

void Collector::waitForDelay() {
  if (_options.storebagDelaySeconds <= 0) return;
  const auto deadline =
      std::chrono::steady_clock::now() + std::chrono::duration_cast<std::chrono::steady_clock::duration>(
                                             std::chrono::duration<double>(_options.storebagDelaySeconds));
  Guard guard(_lock);
  while (!_stopped && std::chrono::steady_clock::now() < deadline) _stopping.waitUntil(_lock, deadline);
}

void Collector::stop() {
  Guard guard(_lock);
  _stopped = true;
  _stopping.notifyAll();
}

}  // namespace velk::collector
