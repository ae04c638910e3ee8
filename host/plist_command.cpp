// `dovel plist`: print or convert a property list.
#include <unistd.h>

#include <algorithm>

#include "host/commands.h"
#include "host/files.h"
#include "host/json.h"
#include "host/text.h"

namespace appsync {

namespace {

using Writer = std::function<void(std::string_view)>;

// Standard output in larger pieces.
class BufferedConsole {
 public:
  explicit BufferedConsole(Console& console) : _console(console) {}
  ~BufferedConsole() { _console.raw(_buffer); }
  BufferedConsole(const BufferedConsole&) = delete;
  BufferedConsole& operator=(const BufferedConsole&) = delete;

  void write(std::string_view bytes) {
    _buffer += bytes;
    if (_buffer.size() < 65536) return;
    _console.raw(_buffer);
    _buffer.clear();
  }

 private:
  Console& _console;
  std::string _buffer;
};

std::string scalarText(const PropertyList& value) {
  switch (value.type()) {
    case PropertyList::Type::String:
      return '"' + printable(*value.stringView()) + '"';
    case PropertyList::Type::Data:
      return "data, " + counted(value.data()->size(), "byte", "bytes");
    case PropertyList::Type::Date:
      return "date " + isoDateText(*value.date()).value_or("beyond the years 1 to 9999");
    case PropertyList::Type::UID:
      return "uid " + std::to_string(*value.uid());
    default:
      return value.description();
  }
}

// One line a value: "  key: value"; what is in a collection stands below it, further to the right.
void outline(const PropertyList& value, const std::string& label, std::size_t depth, const Writer& write) {
  const std::string start = std::string(2 * std::min<std::size_t>(depth, 32), ' ') + label;
  if (value.isArray()) {
    write(start + "array, " + counted(value.count(), "element", "elements") + "\n");
    std::size_t index = 0;
    for (const PropertyList& element : value.elements()) {
      outline(element, std::to_string(index++) + ": ", depth + 1, write);
    }
  } else if (value.isDictionary()) {
    write(start + "dictionary, " + counted(value.count(), "member", "members") + "\n");
    for (const auto member : value.members()) outline(member.value, printable(member.key) + ": ", depth + 1, write);
  } else {
    write(start + scalarText(value) + "\n");
  }
}

// False, with the failure said, when the value has no place in the format.
bool convert(const PropertyList& value, const PlistOptions& options, const Writer& write, Failure& failure) {
  if (!options.to) {
    outline(value, "", 0, write);
    return true;
  }
  if (*options.to == "json") {
    writePropertyListAsJson(value, write);
    return true;
  }
  std::optional<Error> error;
  const auto format = *options.to == "xml" ? PropertyListFormat::XML : PropertyListFormat::Binary;
  const std::optional<Bytes> bytes = serializePropertyList(value, format, &error);
  if (!bytes) {
    failure = {FailureCode::InputUnusable,
               "\"" + options.file + "\" cannot be written as " + *options.to + ": " + error->text(),
               "convert it to another format"};
    return false;
  }
  write({reinterpret_cast<const char*>(bytes->data()), bytes->size()});
  return true;
}

}  // namespace

int runPlist(const PlistOptions& options, Console& console) {
  Failure failure;
  if (options.to == "binary" && !options.output && ::isatty(STDOUT_FILENO) == 1) {
    return console.fail({FailureCode::CommandLine, "binary property lists are not for a terminal",
                         "name a file with -o, or send standard output elsewhere"});
  }
  const std::optional<Bytes> bytes = readInput(options.file, failure);
  if (!bytes) return console.fail(failure);
  std::optional<Error> error;
  const std::optional<PropertyList> value = parsePropertyList(*bytes, &error);
  if (!value) {
    return console.fail({FailureCode::InputUnusable, "\"" + options.file + "\" is no property list: " + error->text(),
                         "give it one in XML or binary form"});
  }
  if (!options.output) {
    BufferedConsole output(console);
    const bool done = convert(
        *value, options, [&](std::string_view text) { output.write(text); }, failure);
    return done ? kStatusDone : console.fail(failure);
  }
  const auto output = OutputFile::create(*options.output, failure);
  if (!output ||
      !convert(
          *value, options, [&](std::string_view text) { output->write(text); }, failure) ||
      !output->finish(failure)) {
    return console.fail(failure);
  }
  return kStatusDone;
}

}  // namespace appsync
