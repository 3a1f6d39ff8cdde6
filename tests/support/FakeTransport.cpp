#include "tests/support/FakeTransport.h"

#include <utility>

namespace velk::test {

FakeTransport::FakeTransport() = default;
FakeTransport::~FakeTransport() = default;

void FakeTransport::postURLRequestWithCompletionHandler(HttpRequest request, HttpCompletion completion) {
  Guard guard(_lock);
  _posts.push_back(Post{std::move(request), std::move(completion)});
}

std::size_t FakeTransport::count() const {
  Guard guard(_lock);
  return _posts.size();
}

HttpRequest FakeTransport::request(std::size_t number) const {
  Guard guard(_lock);
  return _posts.at(number).request;
}

void FakeTransport::answer(std::size_t number, int statusCode) {
  auto response = std::make_shared<HttpResponse>();
  response->statusCode = statusCode;
  takeCompletion(number)(ByteData(), std::move(response), std::nullopt);
}

void FakeTransport::fail(std::size_t number, Error error) {
  takeCompletion(number)(ByteData(), nullptr, std::move(error));
}

void FakeTransport::drop(std::size_t number) { static_cast<void>(takeCompletion(number)); }

HttpCompletion FakeTransport::takeCompletion(std::size_t number) {
  Guard guard(_lock);
  return std::move(_posts.at(number).completion);
}

}  // namespace velk::test
