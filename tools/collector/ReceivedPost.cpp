#include "tools/collector/ReceivedPost.h"

#include <algorithm>

#include "foundation/Format.h"
#include "foundation/Json.h"
#include "foundation/Text.h"
#include "tools/collector/Gzip.h"

namespace velk::collector {
namespace {

Failure refused(std::string why) { return failure("post", 1, std::move(why)); }

std::optional<std::int64_t> number(const PropertyDictionary& event, std::string_view key) {
  const PropertyValue* value = event.find(key);
  if (value == nullptr || !value->isNumber()) return std::nullopt;
  return integerValue(value);
}

std::optional<std::string> text(const PropertyDictionary& event, std::string_view key) {
  const PropertyValue* value = event.find(key);
  if (value == nullptr) return std::nullopt;
  if (const std::string* string = value->string()) return *string;
  // Internal builds give some sessions by number.
  if (value->isNumber()) return std::to_string(integerValue(value));
  return std::nullopt;
}

Result<std::vector<PropertyDictionary>> readEvents(const PropertyArray& array) {
  std::vector<PropertyDictionary> events;
  events.reserve(array.size());
  for (const PropertyValue& element : array) {
    const PropertyDictionary* event = element.dictionary();
    if (event == nullptr) {
      return refused(formatText("event %u of \"events\" is not an object", {events.size()}));
    }
    events.push_back(*event);
  }
  return events;
}

// The end of the string that begins at `begin`, where its closing quote stands (or the text ends).
const char* endOfString(const char* begin, const char* end) {
  const char* at = begin;
  while (at != end && *at != '"') at += (*at == '\\' && at + 1 != end) ? 2 : 1;
  return at;
}

}  // namespace

const std::string* headerValue(const HeaderList& headers, std::string_view name) {
  for (const auto& header : headers) {
    if (equalsIgnoringCase(header.first, name)) return &header.second;
  }
  return nullptr;
}

EventFields eventFields(const PropertyDictionary& event) {
  EventFields fields;
  fields.method = number(event, "_method");
  fields.status = number(event, "_status");
  fields.eventNumber = number(event, "_eventNumber");
  fields.sender = text(event, "_sender");
  fields.session = text(event, "_sessionID");
  return fields;
}

Result<std::string> plainBody(std::string_view wire, const HeaderList& headers, const PostBounds& bounds) {
  if (wire.size() > bounds.wireBytes) return refused("the post is larger than is taken");
  const std::string* encoding = headerValue(headers, "Content-Encoding");
  if (encoding == nullptr || encoding->empty() || equalsIgnoringCase(*encoding, "identity")) {
    if (wire.size() > bounds.bodyBytes) return refused("the post is larger than is taken");
    return std::string(wire);
  }
  if (!equalsIgnoringCase(*encoding, "gzip")) return refused("the only Content-Encoding taken is gzip");
  return unpackGzip(wire, bounds.bodyBytes);
}

Result<ReceivedPost> readPost(std::string_view json) {
  const Result<PropertyValue> value = json::parse(json);
  if (!value) return refused("the body is not JSON: " + value.error().description);
  const PropertyDictionary* body = value->dictionary();
  if (body == nullptr) return refused("the body is not a JSON object");

  const PropertyValue* postTime = body->find("postTime");
  if (postTime == nullptr || !postTime->isNumber() || postTime->boolean() != nullptr) {
    return refused("\"postTime\" is missing or not a number");
  }
  const std::string* clientId = body->string("clientId");
  if (clientId == nullptr) return refused("\"clientId\" is missing or not a string");
  const PropertyArray* array = body->array("events");
  if (array == nullptr) return refused("\"events\" is missing or not an array");
  Result<std::vector<PropertyDictionary>> events = readEvents(*array);
  if (!events) return Failure(std::move(events).error());

  ReceivedPost post;
  post.postTime = doubleValue(postTime);
  post.clientId = *clientId;
  post.events = std::move(*events);
  return post;
}

std::size_t countEvents(std::string_view json) {
  std::size_t count = 0;
  std::size_t depth = 0;
  bool inEvents = false;
  std::string_view key;
  const char* const end = json.data() + json.size();
  for (const char* at = json.data(); at < end; ++at) {
    if (*at == '"') {
      const char* close = std::min(endOfString(at + 1, end), end);
      if (depth == 1) key = std::string_view(at + 1, static_cast<std::size_t>(close - at - 1));
      at = close;
    } else if (*at == '{' || *at == '[') {
      if (inEvents && depth == 2 && *at == '{') ++count;
      if (depth == 1) inEvents = *at == '[' && key == "events";
      ++depth;
    } else if (*at == '}' || *at == ']') {
      if (depth > 0) --depth;
      if (depth <= 1) inEvents = false;
    }
    if (at >= end) break;
  }
  return count;
}

}  // namespace velk::collector
