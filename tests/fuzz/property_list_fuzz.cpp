// Whatever can be read can be written again and reads as the same value; everything else is refused with an error.
#include <cstdio>
#include <cstdlib>

#include "platform/property_list.h"

namespace {

using namespace appsync;

void require(bool condition, const char* what) {
  if (condition) return;
  std::fprintf(stderr, "%s\n", what);
  std::abort();
}

void checkXML(const PropertyList& value, const PropertyListLimits& limits) {
  // Dates lose their fractions in XML, and a dictionary that looks like a UID becomes one: only the second way round
  // has to be the same. Some strings have no place in XML at all.
  const std::optional<Bytes> once = serializePropertyList(value, PropertyListFormat::XML, nullptr);
  if (!once) return;
  const std::optional<PropertyList> read = parsePropertyList(once->data(), once->size(), nullptr, limits);
  require(read.has_value(), "XML that was written cannot be read");
  const std::optional<Bytes> twice = serializePropertyList(*read, PropertyListFormat::XML, nullptr);
  require(twice == once, "XML that was written reads as something else");
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* bytes, std::size_t size) {
  PropertyListLimits limits;
  limits.expandedValues = 100'000;
  std::optional<Error> error;
  const std::optional<PropertyList> value = parsePropertyList(bytes, size, &error, limits);
  require(value.has_value() != error.has_value(), "neither a value nor an error, or both");
  if (!value) return 0;
  require(value->description().size() <= 16 * 1024, "a description is too long");
  const std::optional<Bytes> binary = serializePropertyList(*value, PropertyListFormat::Binary, nullptr);
  require(binary.has_value(), "what was read cannot be written");
  const std::optional<PropertyList> read = parsePropertyList(binary->data(), binary->size(), nullptr, limits);
  require(read == value, "binary that was written reads as something else");
  limits.expandedValues *= 2;  // a UID is a dictionary with an integer there
  checkXML(*value, limits);
  return 0;
}
