#include "Platform/Value.h"

#include <gtest/gtest.h>

#include "Platform/Error.h"
#include "Platform/URL.h"

namespace sl {
namespace {

TEST(ValueTest, TextFormsOfScalars) {
  EXPECT_EQ(Value().description(), "(null)");
  EXPECT_EQ(String("a b \"c\"").description(), "a b \"c\"");  // a string is itself, unquoted
  EXPECT_EQ(Number(int64_t{-42}).description(), "-42");
  EXPECT_EQ(Number(uint64_t{18446744073709551615u}).description(), "18446744073709551615");
  EXPECT_EQ(Number(42.5).description(), "42.5");
  EXPECT_EQ(Number(0.1).description(), "0.1");
  EXPECT_EQ(Boolean(true).description(), "1");
  EXPECT_EQ(Boolean(false).description(), "0");
  EXPECT_EQ(Data(std::string_view("\x01\x02\x03\x04\xff", 5)).description(), "<01020304 ff>");
  EXPECT_EQ(Date(0.0).description(), "2001-01-01 00:00:00 +0000");
  EXPECT_EQ(Date(-1.0).description(), "2000-12-31 23:59:59 +0000");
}

TEST(ValueTest, TextFormsOfCollectionsAndErrors) {
  Array array{String("plain"), String("two words"), Number(int64_t{7}), Array::create(), Dictionary::create()};
  EXPECT_EQ(array.description(),
            "(\n"
            "    plain,\n"
            "    \"two words\",\n"
            "    7,\n"
            "    (\n"
            "    ),\n"
            "    {\n"
            "    }\n"
            ")");

  Dictionary dict{{"b key", Array{Boolean(true)}},
                  {"a", URL::fileURLWithPath("/private/var/mobile/Applications", true)}};
  EXPECT_EQ(dict.description(),
            "{\n"
            "    a = file:///private/var/mobile/Applications/;\n"
            "    \"b key\" = (\n"
            "        1\n"
            "    );\n"
            "}");

  Error described("D", -3, Dictionary{{kLocalizedDescriptionKey, String("went wrong")}, {"Z", Number(int64_t{1})}});
  EXPECT_EQ(described.description(),
            "Error Domain=D Code=-3 \"went wrong\" UserInfo={LocalizedDescription=went wrong, Z=1}");
  Error other("Other", 9);
  EXPECT_EQ(other.description(), "Error Domain=Other Code=9 \"(null)\"");
}

TEST(ValueTest, ChangingACopyLeavesTheSharedValueAlone) {
  Dictionary original{{"k", String("v")}};
  Dictionary copy = original;
  copy.set("k", String("changed"));
  copy.set("new", Number(int64_t{1}));
  EXPECT_EQ(original.get("k").asString().str(), "v");
  EXPECT_FALSE(original.contains("new"));
  EXPECT_EQ(copy.count(), 2u);

  // A value stored inside a container is shared too.
  Array inner{String("x")};
  Dictionary holder{{"inner", inner}};
  Array fromHolder = holder.get("inner").asArray();
  fromHolder.append(String("y"));
  EXPECT_EQ(inner.count(), 1u);
  EXPECT_EQ(holder.get("inner").asArray().count(), 1u);

  // A null dictionary becomes an empty one on its first change; setting null
  // removes the key.
  Dictionary lazy;
  EXPECT_TRUE(lazy.isNull());
  lazy.set("a", Boolean(false));
  lazy.set("a", nullptr);
  EXPECT_TRUE(lazy.isEmpty());
  EXPECT_FALSE(lazy.isNull());

  Array list;
  list.append(String("b"));
  list.insert(String("a"), 0);
  list.insert(String("c"), 99);
  list.removeAt(7);
  EXPECT_EQ(list, (Array{String("a"), String("b"), String("c")}));
}

TEST(ValueTest, EqualityIsByKindAndContent) {
  // A stored boolean false is not the number 0, and true is not 1.
  EXPECT_NE(Value(Boolean(false)), Value(Number(int64_t{0})));
  EXPECT_NE(Value(Boolean(true)), Value(Number(int64_t{1})));
  EXPECT_EQ(Value(Number(int64_t{1})), Value(Number(1.0)));
  EXPECT_NE(Value(Number(int64_t{-1})), Value(Number(UINT64_MAX)));
  EXPECT_EQ(Value(Number(uint64_t{5})), Value(Number(int64_t{5})));
  EXPECT_NE(Value(String("1")), Value(Number(int64_t{1})));
  EXPECT_EQ(Value(Dictionary{{"a", Array{Data(std::string_view("x"))}}}),
            Value(Dictionary{{"a", Array{Data(std::string_view("x"))}}}));
  EXPECT_NE(Value(URL::fileURLWithPath("/a", true)), Value(URL::fileURLWithPath("/a", false)));

  // Asking for the wrong kind yields null, and a null handle answers zeros.
  Value s = String("text");
  EXPECT_TRUE(s.asNumber().isNull());
  EXPECT_EQ(s.asNumber().int64Value(), 0);
  EXPECT_EQ(Dictionary().get("missing"), Value());
  EXPECT_EQ(Array().at(3), Value());
}

TEST(ValueTest, NumberConversions) {
  EXPECT_EQ(Number(uint64_t{5}).type(), Number::Type::Signed);
  EXPECT_EQ(Number(UINT64_MAX).type(), Number::Type::Unsigned);
  EXPECT_EQ(Number(UINT64_MAX).int64Value(), -1);
  EXPECT_EQ(Number(-2.9).int64Value(), -2);
  EXPECT_EQ(Number(1e30).int64Value(), INT64_MAX);
  EXPECT_EQ(Number(int64_t{8}).doubleValue(), 8.0);
}

TEST(ValueTest, FileURLs) {
  URL dir = URL::fileURLWithPath("/private//var/mobile/Applications/", true);
  EXPECT_EQ(dir.path(), "/private/var/mobile/Applications");
  EXPECT_EQ(dir.absoluteString(), "file:///private/var/mobile/Applications/");

  URL file = dir.URLByAppendingPathComponent("Carrier Bundles#1%", false);
  EXPECT_EQ(file.path(), "/private/var/mobile/Applications/Carrier Bundles#1%");
  EXPECT_EQ(file.absoluteString(), "file:///private/var/mobile/Applications/Carrier%20Bundles%231%25");
  EXPECT_FALSE(file.isDirectory());
  EXPECT_EQ(file.URLByDeletingLastPathComponent(), dir);

  EXPECT_EQ(URL::fileURLWithPath("/", true).absoluteString(), "file:///");
  EXPECT_EQ(URL::fileURLWithPath("/", true).URLByAppendingPathComponent("tmp", true).path(), "/tmp");
  EXPECT_TRUE(URL::fileURLWithPath("", false).isNull());
  // A NUL byte would cut the path short where the system reads it.
  using namespace std::string_view_literals;
  EXPECT_TRUE(URL::fileURLWithPath("/tmp/a\0/b"sv, false).isNull());
  EXPECT_TRUE(dir.URLByAppendingPathComponent("\0.app"sv, true).isNull());
  EXPECT_TRUE(dir.URLByAppendingPathExtension("app\0"sv).isNull());

  // Names that are not UTF-8 keep their bytes.
  std::string odd = "/tmp/caf\xe9\xff";
  URL raw = URL::fileURLWithPath(odd, false);
  EXPECT_EQ(raw.path(), odd);
  EXPECT_EQ(raw.absoluteString(), "file:///tmp/caf%E9%FF");

  struct Case {
    const char* path;
    const char* last;
    const char* extension;
  } cases[] = {
      {"/a/Foo.app", "Foo.app", "app"}, {"/a/.hidden", ".hidden", ""}, {"/a/trailing.", "trailing.", ""},
      {"/a/x.tar.gz", "x.tar.gz", "gz"}, {"/a/none", "none", ""},      {"/", "/", ""},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.path);
    URL u = URL::fileURLWithPath(c.path, false);
    EXPECT_EQ(u.lastPathComponent(), c.last);
    EXPECT_EQ(u.pathExtension(), c.extension);
  }
  EXPECT_EQ(URL::fileURLWithPath("/a/Foo", true).URLByAppendingPathExtension("app").path(), "/a/Foo.app");

  EXPECT_EQ(pathComponents("/var//a/b/"), (std::vector<std::string>{"/", "var", "a", "b"}));
  EXPECT_EQ(pathComponents("a/../b"), (std::vector<std::string>{"a", "..", "b"}));
  EXPECT_TRUE(pathComponents("").empty());
}

}  // namespace
}  // namespace sl
