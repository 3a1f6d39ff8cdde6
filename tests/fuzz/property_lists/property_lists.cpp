// What a hostile storebag server (or a file on disk) can hand to the parser of property lists, in either form.
// Whatever is read must be written again in both, unless the form cannot hold it.
#include <cstdint>

#include "platform/PropertyList.h"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  const auto value = velk::propertylist::parse({data, size});
  if (!value) return 0;
  for (const auto form : {velk::propertylist::Form::xml, velk::propertylist::Form::binary}) {
    static_cast<void>(velk::propertylist::serialize(*value, form));
  }
  return 0;
}
