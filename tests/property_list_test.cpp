#include "platform/property_list.h"

#include <gtest/gtest.h>

#include <cmath>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <limits>
#include <ostream>
#include <thread>

namespace appsync {

void PrintTo(const PropertyList& value, std::ostream* stream) {
  *stream << value.description();
}

namespace {

using PL = PropertyList;

Bytes bytesOf(std::string_view text) {
  return {text.begin(), text.end()};
}

Bytes utf16(std::u16string_view text, bool bigEndian) {
  Bytes bytes;
  for (const char16_t unit : text) {
    const auto high = static_cast<std::uint8_t>(unit >> 8);
    const auto low = static_cast<std::uint8_t>(unit & 0xFF);
    bytes.insert(bytes.end(), {bigEndian ? high : low, bigEndian ? low : high});
  }
  return bytes;
}

// A binary property list of these objects, references and offsets of the given sizes.
Bytes binary(const std::vector<std::string>& objects, std::uint8_t referenceSize = 1, std::uint8_t top = 0) {
  Bytes bytes = bytesOf("bplist00");
  Bytes offsets;
  for (const std::string& object : objects) {
    offsets.insert(offsets.end(),
                   {static_cast<std::uint8_t>(bytes.size() >> 8), static_cast<std::uint8_t>(bytes.size())});
    bytes.insert(bytes.end(), object.begin(), object.end());
  }
  const std::size_t table = bytes.size();
  bytes.insert(bytes.end(), offsets.begin(), offsets.end());
  Bytes trailer(32);
  trailer[6] = 2;
  trailer[7] = referenceSize;
  trailer[14] = static_cast<std::uint8_t>(objects.size() >> 8);
  trailer[15] = static_cast<std::uint8_t>(objects.size());
  trailer[23] = top;
  trailer[30] = static_cast<std::uint8_t>(table >> 8);
  trailer[31] = static_cast<std::uint8_t>(table);
  bytes.insert(bytes.end(), trailer.begin(), trailer.end());
  return bytes;
}

std::string operator""_s(const char* text, std::size_t size) {
  return {text, size};
}

PL parsed(const Bytes& bytes) {
  std::optional<Error> error;
  std::optional<PL> value = parsePropertyList(bytes, &error);
  EXPECT_TRUE(value) << (error ? error->description() : "no error");
  return value.value_or(PL("(not parsed)"));
}

PL parsed(std::string_view xml) {
  return parsed(bytesOf(xml));
}

Bytes written(const PL& value, PropertyListFormat format) {
  std::optional<Error> error;
  const std::optional<Bytes> bytes = serializePropertyList(value, format, &error);
  EXPECT_TRUE(bytes) << (error ? error->description() : "no error");
  return bytes.value_or(Bytes());
}

std::string refusal(const Bytes& bytes) {
  std::optional<Error> error;
  if (parsePropertyList(bytes, &error)) return "(parsed)";
  return error ? error->description() : "(no error)";
}

std::string refusalToWrite(const PL& value, PropertyListFormat format) {
  std::optional<Error> error;
  if (serializePropertyList(value, format, &error)) return "(written)";
  return error ? error->description() : "(no error)";
}

PL nested(std::size_t levels) {
  PL value = PL::array();
  for (std::size_t i = 1; i < levels; ++i) value = i % 2 != 0 ? PL::array({value}) : PL::dictionary({{"k", value}});
  return value;
}

PL everything() {
  PL all =
      PL::array({PL("text"), PL(""), PL("grün 📷 <&>\"'\r\n\t"), PL(true), PL(false), PL::array(), PL::dictionary()});
  for (const std::int64_t n :
       {std::int64_t{0}, std::int64_t{255}, std::int64_t{256}, std::int64_t{65535}, std::int64_t{65536},
        std::int64_t{0xFFFFFFFF}, std::int64_t{0x100000000}, std::int64_t{-1}, (std::int64_t{1} << 59) - 1,
        std::int64_t{1} << 59, -(std::int64_t{1} << 59) - 1, std::numeric_limits<std::int64_t>::min(),
        std::numeric_limits<std::int64_t>::max()}) {
    all.append(PL::integer(n));
  }
  for (const std::uint64_t n : {std::uint64_t{1} << 63, ~std::uint64_t{0}}) all.append(PL::unsignedInteger(n));
  for (const double r : {0.0, 1.5, 0.1, -1e300, 5e-324, std::nan(""), std::numeric_limits<double>::infinity(),
                         -std::numeric_limits<double>::infinity()}) {
    all.append(PL::real(r));
  }
  for (const double d : {0.0, 1.0, -63113904000.0, 252423993599.0, 700000000.0}) all.append(PL::date(d));
  for (const std::uint64_t u : {std::uint64_t{0}, std::uint64_t{256}, ~std::uint64_t{0}}) all.append(PL::uid(u));
  for (std::size_t size : {0U, 1U, 2U, 3U, 14U, 15U, 57U, 58U, 300U}) all.append(PL::data(Bytes(size, 0xA7)));
  all.append(PL::real32(0.1F));
  all.append(std::string(300, 'x'));
  all.append(PL::dictionary({{"z", all}, {"a", PL("same")}, {"m", PL("same")}, {"ключ", PL("a")}}));
  return all;
}

TEST(PropertyList, EveryTypeSurvivesBothFormatsAndBack) {
  const PL value = everything();
  const Bytes xml = written(value, PropertyListFormat::XML);
  const Bytes fromXML = written(parsed(xml), PropertyListFormat::Binary);
  EXPECT_EQ(parsed(fromXML), value);
  EXPECT_EQ(written(parsed(fromXML), PropertyListFormat::XML), xml);

  const PL back = parsed(written(value, PropertyListFormat::Binary));
  EXPECT_EQ(back, value);
  EXPECT_TRUE(back.elements()[back.count() - 3].isReal32());
  EXPECT_EQ(parsed(written(PL::date(0.25), PropertyListFormat::Binary)).date(), 0.25);
  EXPECT_EQ(parsed(written(PL::date(-0.25), PropertyListFormat::XML)).date(), -1.0) << "cut off towards the past";
}

TEST(PropertyList, BinaryHoldsEachStringOnce) {
  const PL entry = parsed(
      "<array><dict><key>identifier</key><string>name</string><key>name</key>"
      "<string>identifier</string></dict><dict><key>name</key><string>name</string></dict></array>");
  const Bytes bytes = written(entry, PropertyListFormat::Binary);
  // header, array, two dictionaries, two strings, five offsets, trailer
  EXPECT_EQ(bytes.size(), 8U + 3 + 5 + 3 + 11 + 5 + 5 + 32);
}

TEST(PropertyList, NumbersFlagsAndEquality) {
  EXPECT_EQ(PL::unsignedInteger(7), PL::integer(7));
  EXPECT_EQ(PL::unsignedInteger(~std::uint64_t{0}).integer(), std::nullopt);
  EXPECT_EQ(PL::integer(-1).unsignedInteger(), std::nullopt);
  EXPECT_EQ(PL::real32(0.5F), PL::real(0.5));
  EXPECT_NE(PL::integer(1), PL::real(1));
  EXPECT_NE(PL::integer(1), PL(true));
  EXPECT_EQ(PL::dictionary({{"a", PL("1")}, {"b", PL("2")}}), PL::dictionary({{"b", PL("2")}, {"a", PL("1")}}));
  EXPECT_NE(PL::dictionary({{"a", PL("1")}}), PL::dictionary({{"b", PL("1")}}));
  EXPECT_NE(PL::array({PL("1"), PL("2")}), PL::array({PL("2"), PL("1")}));

  const std::vector<std::pair<PL, std::optional<bool>>> flags = {{PL(true), true},
                                                                 {PL(false), false},
                                                                 {PL::integer(-3), true},
                                                                 {PL::integer(0), false},
                                                                 {PL::real(0.1), true},
                                                                 {PL("YES"), true},
                                                                 {PL("true"), true},
                                                                 {PL("no"), false},
                                                                 {PL("  -0012"), true},
                                                                 {PL("000"), false},
                                                                 {PL("x1"), false},
                                                                 {PL(""), false},
                                                                 {PL::array(), std::nullopt},
                                                                 {PL::uid(1), std::nullopt},
                                                                 {PL::date(1), std::nullopt}};
  for (const auto& [value, flag] : flags) EXPECT_EQ(value.flag(), flag) << value.description();
}

TEST(PropertyList, CopiesAreIndependentAndViewsKeepWhatTheyShow) {
  PL original = parsed("<dict><key>list</key><array><string>a</string></array><key>n</key><integer>1</integer></dict>");
  PL copy = original;
  PL list = *copy.find("list");
  const PL::Array before = list.elements();
  list.append("b");
  list.replace(0, "c");
  copy.set("list", list);
  EXPECT_TRUE(copy.remove("n"));
  EXPECT_FALSE(copy.remove("n"));
  EXPECT_EQ(original.description(), "{list = [a], n = 1}");
  EXPECT_EQ(copy.description(), "{list = [c, b]}");
  ASSERT_EQ(before.size(), 1U);
  EXPECT_EQ(before[0], PL("a"));
  copy.set("self", copy);
  EXPECT_EQ(copy.description(), "{list = [c, b], self = {list = [c, b]}}");
}

TEST(PropertyList, DictionariesOfAnySizeKeepTheirOrderThroughChanges) {
  for (const int size : {1, 8, 9, 254, 255, 3000}) {
    PL value = PL::dictionary();
    for (int i = 0; i < size; ++i) value.set("key" + std::to_string(i), PL::integer(i));
    const PL whole = value;
    for (int i = 0; i < size; i += 2) EXPECT_TRUE(value.remove("key" + std::to_string(i)));
    for (int i = 0; i < size; i += 4) value.set("key" + std::to_string(i), PL::integer(-i));
    std::vector<std::string> expected;
    for (int i = 1; i < size; i += 2) expected.push_back("key" + std::to_string(i));
    for (int i = 0; i < size; i += 4) expected.push_back("key" + std::to_string(i));
    const auto order = [](const PL& dictionary) {
      std::vector<std::string> keys;
      for (const auto& [key, member] : dictionary.members()) {
        EXPECT_EQ(dictionary.find(key), &member);
        keys.emplace_back(key);
      }
      return keys;
    };
    EXPECT_EQ(order(value), expected);
    EXPECT_EQ(order(parsed(written(value, PropertyListFormat::Binary))), expected);
    EXPECT_EQ(order(parsed(written(value, PropertyListFormat::XML))), expected);
    EXPECT_EQ(order(whole).size(), static_cast<std::size_t>(size));
    EXPECT_EQ(value.find("key2"), nullptr);
  }
}

TEST(PropertyList, DescriptionsAreOneBoundedLine) {
  EXPECT_EQ(PL::dictionary({{"a", PL::array({PL::integer(-1), PL::real(1.5), PL(true)})},
                            {"b", PL::data(Bytes{1, 2})},
                            {"c", PL::date(1)},
                            {"d", PL::uid(3)}})
                .description(),
            "{a = [-1, 1.5, true], b = <2 bytes>, c = 2001-01-01T00:00:01Z, d = <UID 3>}");
  PL wide = PL::array();
  for (int i = 0; i < 1'000; ++i) wide.append(std::string(3000, 'y'));
  for (const PL& value : {wide, nested(100'000), PL(std::string(20'000, 'x')), PL::dictionary({{"k", wide}})}) {
    EXPECT_LE(value.description().size(), 16U * 1024);
    EXPECT_NE(value.description().find("…"), std::string::npos);
  }
}

TEST(PropertyList, DeepAndSharedValuesTakeNoStackAndNoLongTime) {
  const PL deep = nested(200'000);
  EXPECT_EQ(deep, nested(200'000));
  EXPECT_NE(deep, nested(199'998));
  PL left = PL::array({PL("x")});
  PL right = PL::array({PL("x")});
  for (int i = 0; i < 100; ++i) {
    left = PL::array({left, left});
    right = PL::array({right, right});
  }
  EXPECT_EQ(left, right);
  for (const auto format : {PropertyListFormat::XML, PropertyListFormat::Binary}) {
    EXPECT_NE(refusalToWrite(deep, format).find("512 levels"), std::string::npos);
    EXPECT_EQ(parsed(written(nested(512), format)), nested(512));
    EXPECT_NE(refusalToWrite(nested(513), format).find("512 levels"), std::string::npos);
  }
  EXPECT_NE(refusalToWrite(left, PropertyListFormat::Binary).find("values cannot be written"), std::string::npos);
}

TEST(PropertyList, ThreadsMayUseCopiesOfOneValue) {
  const PL value = everything();
  const auto work = [value]() mutable {
    for (int i = 0; i < 100; ++i) {
      PL copy = value;
      copy.append(PL::integer(i));
      ASSERT_NE(copy, value);
      copy = value.elements()[0];
    }
  };
  std::thread first(work);
  std::thread second(work);
  first.join();
  second.join();
}

TEST(PropertyListXML, ReadsWhatDocumentsMayBringAlong) {
  const std::string head = "<?xml version=\"1.0\" encoding=\"UTF-8\"?>";
  const std::vector<std::pair<std::string, PL>> cases = {
      {"<string>bare</string>", PL("bare")},
      {" \n<!-- c --><plist><?pi?><!-- - --> <true/></plist> <!-- end -->\n", PL(true)},
      {head + "<!DOCTYPE plist PUBLIC \"-//X//>[\" 'it\"s.dtd'><plist version='1.0'><false></false></plist>",
       PL(false)},
      {head + "<!DOCTYPE plist [<!ENTITY a \"]>'\"><!-- ]>\" ' --><?pi ]> ?><!ELEMENT b (c)>] ><string>d</string>",
       PL("d")},
      {"<string>&lt;&amp;&gt;&quot;&apos;&#65;&#x1F4F7;</string>", PL("<&>\"'A📷")},
      {"<string>a<![CDATA[<b>&amp;]]>c<!-- d -->e<?f?></string >", PL("a<b>&amp;ce")},
      {"<string>a\r\nb\rc&#13;</string>", PL("a\nb\nc\r")},
      {"<string/>", PL("")},
      {"<array />", PL::array()},
      {"<dict></dict>", PL::dictionary()},
      {"<dict><key/><array/><key>k</key><true/></dict>", PL::dictionary({{"", PL::array()}, {"k", PL(true)}})},
      {"<dict><key>k</key><true/><key>k</key><false/></dict>", PL::dictionary({{"k", PL(false)}})},
      {"<dict><key>CF$UID</key><integer>7</integer></dict>", PL::uid(7)},
      {"<dict><key>CF$UID</key><string>7</string></dict>", PL::dictionary({{"CF$UID", PL("7")}})},
      {"<integer> +12 </integer>", PL::integer(12)},
      {"<integer>-0x10</integer>", PL::integer(-16)},
      {"<integer>0xFFFFFFFFFFFFFFFF</integer>", PL::unsignedInteger(~std::uint64_t{0})},
      {"<integer>-9223372036854775808</integer>", PL::integer(std::numeric_limits<std::int64_t>::min())},
      {"<real>+1e3</real>", PL::real(1000)},
      {"<real>NaN</real>", PL::real(std::nan(""))},
      {"<real>-Infinity</real>", PL::real(-std::numeric_limits<double>::infinity())},
      {"<real>+inf</real>", PL::real(std::numeric_limits<double>::infinity())},
      {"<date>2024-02-29T12:34:56Z</date>", PL::date(730902896)},
      {"<data>\n\tAQ ID\n\tBA==\n</data>", PL::data(Bytes{1, 2, 3, 4})},
      {"\xEF\xBB\xBF" + head + "<string>ü</string>", PL("ü")},
  };
  for (const auto& [xml, value] : cases) EXPECT_EQ(parsed(xml), value) << xml;

  const std::u16string document = u"<?xml version=\"1.0\" encoding=\"UTF-16\"?><string>ü📷</string>";
  for (const bool bigEndian : {false, true}) {
    EXPECT_EQ(parsed(utf16(document, bigEndian)), PL("ü📷"));
    EXPECT_EQ(parsed(utf16(u"\xFEFF" + document, bigEndian)), PL("ü📷"));
  }
}

TEST(PropertyListXML, RefusesWhatItCannotReadAndSaysWhere) {
  std::string bomb = "<!DOCTYPE p [<!ENTITY a \"aaaaaaaaaa\">";
  for (char c = 'b'; c < 'k'; ++c) bomb += std::string("<!ENTITY ") + c + " \"" + std::string(10, '&') + "\">";
  const std::string deep = std::string(513 * 7, ' ');
  std::string levels;
  for (int i = 0; i < 513; ++i) levels += "<array>";
  const std::vector<std::pair<std::string, std::string>> cases = {
      {"", "empty, at byte 0"},
      {" <!-- -->", "empty, at byte 9"},
      {"{ a = b; }", "neither XML nor a binary property list, at byte 0"},
      {"<plist></plist>", "holds no value, at byte 7"},
      {"<plist><true/><true/></plist>", "second value, at byte 14"},
      {"<plist><plist>", "<plist> within <plist>, at byte 7"},
      {"<true/>x", "something follows the property list, at byte 7"},
      {"<true/><true/>", "something follows"},
      {"<array><string>", "the document ends within <string>, at byte 15"},
      {"<array>", "the document ends within <array>, at byte 7"},
      {"<array>x</array>", "text outside of a value, at byte 7"},
      {"<array></dict>", "</dict> where <array> is open, at byte 7"},
      {"<string>a</key>", "</key> where <string> is open, at byte 9"},
      {"<string><b/></string>", "an element within <string>, at byte 8"},
      {"</array>", "nothing is open"},
      {"<dict><true/></dict>", "<true> where <dict> needs a <key>, at byte 6"},
      {"<dict><key>a</key></dict>", "a <key> without a value, at byte 18"},
      {"<dict><key>a</key><key>b</key></dict>", "a <key> after a <key>, at byte 18"},
      {"<array><key>a</key></array>", "a <key> outside of a <dict>"},
      {"<set/>", "an unknown element <set>, at byte 0"},
      {"<true>no</true>", "text within <true>"},
      {"<true a></true>", "attribute"},
      {"<true a='b", "does not end"},
      {"<", "begins no tag"},
      {"<!-- ", "a comment that does not end"},
      {"<string><![CDATA[", "a CDATA section that does not end"},
      {"<!DOCTYPE x [ \"", "a document type that does not end"},
      {bomb + "]><string>&b;</string>", "an entity \"b\" that is not defined"},
      {"<string>&</string>", "begins no reference, at byte 8"},
      {"<string>&#0;</string>", "no character"},
      {"<string>&#xD800;</string>", "no character"},
      {"<string>&#99999999999;</string>", "no character"},
      {"<string>\x01</string>", "a character that XML does not allow, at byte 8"},
      {"<string>\xC0\x80</string>", "not valid UTF-8, at byte 8"},
      {"<string>\xED\xA0\x80</string>", "not valid UTF-8, at byte 8"},
      {"<?xml version='1.0' encoding='latin1'?><true/>", "encoding is \"latin1\"; only UTF-8"},
      {"<?xml version='1.0' encoding='UTF-16'?><true/>", "bytes are not"},
      {"<integer/>", "<integer> holds \"\""},
      {"<integer>1 2</integer>", "<integer> holds \"1 2\""},
      {"<integer>18446744073709551616</integer>", "<integer> holds"},
      {"<integer>-9223372036854775809</integer>", "<integer> holds"},
      {"<real>1,5</real>", "<real> holds"},
      {"<date>2023-02-29T00:00:00Z</date>", "<date> holds"},
      {"<date>2023-02-01</date>", "<date> holds"},
      {"<data>AAA</data>", "<data> holds"},
      {"<data>A?==</data>", "<data> holds"},
      {levels, "beyond 512 levels, at byte 3584"},
  };
  for (const auto& [xml, text] : cases) {
    EXPECT_NE(refusal(bytesOf(xml)).find(text), std::string::npos)
        << xml.substr(0, 80) << "\n  " << refusal(bytesOf(xml));
  }
  EXPECT_NE(refusal(utf16(u"\xFEFF<array>\xD83D</array>", true)).find("a lone surrogate, at byte 16"),
            std::string::npos);
  EXPECT_NE(refusal(utf16(u"\xFEFF<string>ü📷</b>", false)).find("is open, at byte 24"), std::string::npos);
}

TEST(PropertyListBinary, ReadsHandMadeBytes) {
  const std::vector<std::pair<Bytes, PL>> cases = {
      {binary({"\x08"}), PL(false)},
      {binary({"\x10\xFF"}), PL::integer(255)},
      {binary({"\x11\xFF\xFE"}), PL::integer(65534)},
      {binary({"\x12\xFF\xFF\xFF\xFF"}), PL::integer(0xFFFFFFFF)},
      {binary({"\x13\xFF\xFF\xFF\xFF\xFF\xFF\xFF\xFF"}), PL::integer(-1)},
      {binary({"\x14\0\0\0\0\0\0\0\0\xFF\xFF\xFF\xFF\xFF\xFF\xFF\xFF"_s}), PL::unsignedInteger(~std::uint64_t{0})},
      {binary({"\x14" + std::string(16, '\xFF')}), PL::integer(-1)},
      {binary({"\x22\x3F\x80\0\0"_s}), PL::real(1)},
      {binary({"\x33\0\0\0\0\0\0\0\0"_s}), PL::date(0)},
      {binary({"\x42\x01\x02"}), PL::data(Bytes{1, 2})},
      {binary({"\x5F\x10\x03"
               "abc"}),
       PL("abc")},
      {binary({"\x63\0\xFC\xD8\x3D\xDC\xF7"_s}), PL("ü📷")},
      {binary({"\x82\x01\0\0"_s}), PL::uid(65536)},
      {binary({"\x09", "\xA2\0\0"_s}, 1, 1), PL::array({PL(true), PL(true)})},
      {binary({"\xD2\x01\x01\x02\x03"_s, "\x51k", "\x09", "\x08"}), PL::dictionary({{"k", PL(false)}})},
      {binary({"\xD2\x01\x02\x03\x04"_s, "\x51k", "\x51k", "\xA1\x05", "\x08", "\x51x"}),
       PL::dictionary({{"k", PL(false)}})},
  };
  for (const auto& [bytes, value] : cases) EXPECT_EQ(parsed(bytes), value);
}

TEST(PropertyListBinary, RefusesWhatItCannotReadAndSaysWhere) {
  const auto changed = [](std::size_t fromEnd, std::uint8_t value) {
    Bytes bytes = binary({"\xA1\x01", "\x09"});
    bytes[bytes.size() - fromEnd] = value;
    return bytes;
  };
  std::vector<std::string> chain;
  for (int i = 1; i <= 300; ++i) chain.push_back("\xA1"_s + static_cast<char>(i >> 8) + static_cast<char>(i & 0xFF));
  chain.emplace_back("\x09");
  // Reaches one chain of 299 levels at once, and again below another one of 300.
  std::vector<std::string> shared = {"\xA2\0\x01\x01\x2D"_s};
  for (int i = 2; i <= 601; ++i) {
    const int next = i == 601 ? 1 : i;
    shared.push_back(i == 301 ? "\x09"_s : "\xA1"_s + static_cast<char>(next >> 8) + static_cast<char>(next & 0xFF));
  }
  std::vector<std::string> bomb;
  for (char i = 1; i < 60; ++i) bomb.push_back(std::string("\xA2") + i + i);
  bomb.emplace_back("\x09");

  const std::vector<std::pair<Bytes, std::string>> cases = {
      {bytesOf("bplist00"), "too short"},
      {bytesOf("bplist15" + std::string(60, '\0')), "version other than 00, at byte 6"},
      {changed(26, 0), "offset size is 0"},
      {changed(26, 9), "offset size is 9"},
      {changed(25, 9), "reference size is 9"},
      {changed(24, 0xFF), "object count"},
      {changed(17, 0), "object count 0"},
      {changed(17, 3), "object count 3"},
      {changed(16, 0xFF), "top object"},
      {changed(9, 2), "top object 2"},
      {changed(8, 0xFF), "offset table"},
      {changed(1, 7), "offset table at 7"},
      {changed(33, 11), "the offset 11 of object 1 is not among the objects, at byte 13"},
      {changed(33, 8), "objects overlap each other, at byte 8"},
      {binary({"\xA1\x07"}), "a reference to object 7 of 1, at byte 9"},
      {binary({"\xA1\0"_s}), "contains itself"},
      {binary({"\xD1\x01\0"_s, "\x51k"}), "contains itself"},
      {binary({"\xD1\x01\x01", "\x09"}), "key is no string, at byte 9"},
      {binary({"\xD1\x01\x02", "\xA0", "\x09"}), "key is no string"},
      {binary({"\0"_s}), "a null object"},
      {binary({"\x0F"}), "a fill byte"},
      {binary({"\xC1\0"_s}), "a set object"},
      {binary({"\xB0"}), "a set object"},
      {binary({"\x70"}), "an unknown kind of object 0x70, at byte 8"},
      {binary({"\x15"}), "unknown kind"},
      {binary({"\x14" + std::string(8, '\x01') + std::string(8, '\0')}), "an integer beyond 64 bits, at byte 8"},
      {binary({"\x14" + std::string(8, '\xFF') + std::string(8, '\0')}), "an integer beyond 64 bits"},
      {binary({"\x24"}), "a real of a width"},
      {binary({"\x33\x7F\xF0\0\0\0\0\0\0"_s}), "a date outside the years"},
      {binary({"\x13\x01"}), "object runs past"},
      {binary({"\x5F"}), "object runs past"},
      {binary({"\x5F\x14"}), "no integer of 1 to 8 bytes"},
      {binary({"\x5F\x13\xFF\xFF\xFF\xFF\xFF\xFF\xFF\xFF"}), "a count of 18446744073709551615 where fewer"},
      {binary({"\xAF\x13\x7F\xFF\xFF\xFF\xFF\xFF\xFF\xFF"}), "where fewer bytes are left"},
      {binary({"\x6F\x13\x80\0\0\0\0\0\0\x01"_s}), "where fewer bytes are left"},
      {binary({"\xD8\0\0\0\0\0\0\0\0\0\0"_s}), "where fewer bytes are left"},
      {binary({"\x51\xFC"}), "beyond ASCII"},
      {binary({"\x61\xD8\x3D"}), "a lone surrogate in a string, at byte 9"},
      {binary({"\x62\xDC\x3D\0x"_s}), "a lone surrogate"},
      {binary({"\x8F\x01" + std::string(15, '\0')}), "a UID beyond 64 bits"},
      {binary(bomb), "reach more than 20000000 values"},
      {binary(shared, 2), "beyond 512 levels"},
  };
  for (const auto& [bytes, text] : cases)
    EXPECT_NE(refusal(bytes).find(text), std::string::npos) << text << "\n  " << refusal(bytes);
  EXPECT_EQ(parsed(binary(chain, 2)).type(), PL::Type::Array);

  const Bytes whole = written(everything(), PropertyListFormat::Binary);
  for (std::size_t size = 0; size < whole.size(); ++size) {
    EXPECT_FALSE(parsePropertyList(whole.data(), size, nullptr)) << size;
  }
}

// A megabyte in which 60,000 objects are one and the same long string would else become many gigabytes.
TEST(PropertyListBinary, ObjectsThatOverlapDoNotExhaustMemory) {
  Bytes bytes = binary({"\xA3\x01\x02\x03", "\x5F\x10\x20" + std::string(32, 'x'), "\x09", "\x08"});
  bytes[bytes.size() - 35] = 12;  // the offsets of the last two objects
  bytes[bytes.size() - 33] = 12;
  EXPECT_NE(refusal(bytes).find("objects overlap"), std::string::npos) << refusal(bytes);
}

TEST(PropertyList, RefusesToWriteWhatAFormatCannotHold) {
  const std::vector<std::tuple<PL, std::string, std::string>> cases = {
      {PL("a\x01z"), "the string \"a?z\" has at its byte 1 a control character", "(written)"},
      {PL("\xEF\xBF\xBE"), "XML cannot hold", "(written)"},
      {PL("a\xFF"), "the string \"a?\" is not UTF-8", "the string \"a?\" is not UTF-8"},
      {PL::dictionary({{"\x02", PL(true)}}), "the string \"?\"", "(written)"},
      {PL::date(252423993600.0), "outside the years", "outside the years"},
      {PL::date(std::nan("")), "outside the years", "outside the years"},
  };
  for (const auto& [value, xml, bin] : cases) {
    EXPECT_NE(refusalToWrite(value, PropertyListFormat::XML).find(xml), std::string::npos) << xml;
    EXPECT_NE(refusalToWrite(value, PropertyListFormat::Binary).find(bin), std::string::npos) << bin;
  }
}

TEST(PropertyList, AMillionEntriesAreNoTrouble) {
  PL list = PL::array();
  PL dictionary = PL::dictionary();
  for (int i = 0; i < 1'000'000; ++i) {
    list.append(std::to_string(i));
    if (i % 4 == 0) dictionary.set(std::to_string(i), PL::integer(i));
  }
  list.append(dictionary);
  const PL back = parsed(written(list, PropertyListFormat::Binary));
  EXPECT_EQ(back, list);
  EXPECT_EQ(back.elements()[1'000'000].find("999996")->integer(), 999'996);
}

// Whether `reader`, a Python expression over the bytes `b` and the module, holds for what is written.
bool pythonAgrees(const std::filesystem::path& file, const std::string& check) {
  const std::string command = "python3 -c \"import plistlib,datetime;v=plistlib.load(open('" + file.string() +
                              "','rb'));assert " + check + "\"";
  return std::system(command.c_str()) == 0;
}

TEST(PropertyList, AnotherReaderReadsBothFormats) {
  if (std::system("python3 -c 'import plistlib' 2>/dev/null") != 0) GTEST_SKIP() << "python3 is not there";
  const PL value =
      PL::dictionary({{"s", PL("ü<&>")},
                      {"l", PL::array({PL::integer(-5), PL::unsignedInteger(~std::uint64_t{0}), PL::real(0.1)})},
                      {"t", PL::date(86400)},
                      {"b", PL::data(Bytes(100, 7))},
                      {"e", PL::array({PL::array(), PL::dictionary(), PL("")})}});
  const auto file = std::filesystem::temp_directory_path() / ("property_list_test." + std::to_string(std::rand()));
  for (const auto format : {PropertyListFormat::XML, PropertyListFormat::Binary}) {
    const Bytes bytes = written(value, format);
    std::ofstream(file, std::ios::binary)
        .write(reinterpret_cast<const char*>(bytes.data()), static_cast<std::streamsize>(bytes.size()));
    EXPECT_TRUE(pythonAgrees(file,
                             "list(v.items())==[('s','\\u00fc<&>'),('l',[-5,2**64-1,0.1]),"
                             "('t',datetime.datetime(2001,1,2)),('b',bytes([7])*100),('e',[[],{},''])]"));
  }
  std::filesystem::remove(file);
}

TEST(Error, DescribesItselfAndWhatCausedIt) {
  const Error first("Inner", -1);
  const Error second("Middle", 2, "no room", first);
  const Error third("Outer", 3, "cannot save", second);
  EXPECT_EQ(third.description(), "Outer 3: cannot save (Middle 2: no room (Inner -1))");
  EXPECT_EQ(third.information().description(),
            "{Text = cannot save, Underlying = {Domain = Middle, Code = 2, Information = {Text = no room, Underlying = "
            "{Domain = Inner, Code = -1, Information = {}}}}}");
  EXPECT_EQ(third.underlyingError(), second);
  EXPECT_NE(second, Error("Middle", 2, "no room"));
  EXPECT_EQ(first, Error("Inner", -1));
}

}  // namespace
}  // namespace appsync
