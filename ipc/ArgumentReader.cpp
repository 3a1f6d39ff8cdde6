#include "ipc/ArgumentReader.h"

namespace velk::ipc {

ByteData ArgumentReader::bytes() {
  const auto text = byteString();
  return {text.begin(), text.end()};
}

std::string ArgumentReader::byteString() {
  const auto* value = next();
  if (value != nullptr && value->string() != nullptr) return *value->string();
  if (value != nullptr && value->data() != nullptr) return {value->data()->begin(), value->data()->end()};
  _sound = false;
  return {};
}

double ArgumentReader::real() {
  const auto* value = next();
  if (value != nullptr && value->isNumber() && value->boolean() == nullptr) return doubleValue(value);
  _sound = false;
  return 0;
}

std::optional<PropertyValue> ArgumentReader::optionalValue() {
  auto* value = next();
  if (value == nullptr || value->isNull()) return std::nullopt;
  return std::move(*value);
}

std::optional<Error> ArgumentReader::optionalError() {
  auto values = optionalArray();
  if (!values) return std::nullopt;
  if (values->size() == 3 && (*values)[0].string() != nullptr && (*values)[1].integer() != nullptr &&
      (*values)[2].string() != nullptr) {
    return Error{*(*values)[0].string(), int32Value(&(*values)[1]), *(*values)[2].string()};
  }
  _sound = false;
  return std::nullopt;
}

}  // namespace velk::ipc
