#include "platform/TypeIdentifiers.h"

#include <gtest/gtest.h>
#include <sys/stat.h>

#include <string>
#include <vector>

#include "base/Log.h"
#include "tests/platform/Helpers.h"

namespace vantrel::platform {
namespace {

using Strings = std::vector<std::string>;

std::string xmlStrings(const Strings& items) {
  std::string out = "<array>";
  for (const std::string& s : items) out += "<string>" + s + "</string>";
  return out + "</array>";
}

// One declaration, as the dictionary XML of a types.plist entry.
std::string decl(const std::string& id, const Strings& parents, const Strings& mimes = {},
                 const Strings& extensions = {}) {
  return "<dict><key>identifier</key><string>" + id + "</string><key>conformsTo</key>" +
         xmlStrings(parents) + "<key>mimeTypes</key>" + xmlStrings(mimes) +
         "<key>extensions</key>" + xmlStrings(extensions) + "</dict>";
}

std::string typesFile(const std::string& entries) {
  return xmlPlist("<array>" + entries + "</array>");
}

// Each case is "type < parent" (conforms) or "type !< parent" (does not).
void expectConformance(const TypeRegistry& types, std::initializer_list<std::string> cases) {
  for (const std::string& c : cases) {
    const size_t space = c.find(' '), lt = c.find("< ");
    const bool expected = c[space + 1] != '!';
    EXPECT_EQ(types.conformsTo(c.substr(0, space), c.substr(lt + 2)), expected) << c;
  }
}

TEST(TypeIdentifiers, BuiltInConformanceIsReflexiveAndTransitive) {
  const TypeRegistry types = TypeRegistry::load({});
  expectConformance(types,
                    {"public.jpeg < public.jpeg", "public.jpeg < public.item",
                     "public.jpeg < public.content", "public.utf8-plain-text < public.text",
                     "public.svg-image < public.xml", "public.svg-image < public.image",
                     "public.folder < public.item", "public.folder !< public.data",
                     "public.image !< public.jpeg", "public.zip-archive !< public.content",
                     "public.JPEG !< public.jpeg", "com.example.unknown < com.example.unknown",
                     "com.example.unknown !< public.item", "public.jpeg !< com.example.unknown"});
  EXPECT_TRUE(types.conformsTo("", ""));
  EXPECT_EQ(types.supertypes("com.example.unknown"), Strings{});
}

TEST(TypeIdentifiers, MimeTypeAndExtensionLookup) {
  testing::TempDir tmp;
  tmp.write("sdk/types.plist", typesFile(decl("com.example.photo", {"public.jpeg"},
                                              {"Image/X-Example", "image/jpeg"}, {"EXPH", "jpg"})));
  const TypeRegistry types = TypeRegistry::load({tmp.file("sdk")});
  const std::optional<std::string> none;
  struct Case {
    const char* tag;
    std::optional<std::string> mime, extension;
  } cases[] = {{"image/jpeg", "public.jpeg", none},
               {"IMAGE/JPEG", "public.jpeg", none},
               {" text/plain; charset=utf-8", "public.plain-text", none},
               {"text/xml", "public.xml", none},
               {"application/xml", "public.xml", none},
               {"image/x-example", "com.example.photo", none},
               {"jpg", none, "public.jpeg"},  // the built-in's claim stands
               {".JPG", none, "public.jpeg"},
               {"exph", none, "com.example.photo"},
               {"", none, none},
               {".", none, none},
               {"..jpg", none, none},
               {"image/", none, none},
               {"image/jpeg/x", none, none},
               {"a/jpg", none, none}};
  for (const Case& c : cases) {
    EXPECT_EQ(types.typeForMimeType(c.tag), c.mime) << c.tag;
    EXPECT_EQ(types.typeForFilenameExtension(c.tag), c.extension) << c.tag;
  }
}

TEST(TypeIdentifiers, DeclarationsAcrossDirectoriesCyclesAndUnknownParents) {
  testing::TempDir tmp;
  tmp.write("one/types.plist",
            typesFile(decl("com.example.raw", {"public.image", "com.example.camera"}) +
                      decl("com.example.a", {"com.example.b"}) +
                      decl("com.example.b", {"com.example.c"}) +
                      decl("com.example.c", {"com.example.a", "public.text"}) +
                      decl("com.example.d", {"com.example.a"}) +
                      decl("com.example.self", {"com.example.self"}) +
                      decl("com.example.orphan", {"com.example.nowhere", "public.data"})));
  tmp.write("two/types.plist", typesFile(decl("com.example.camera", {"public.content"})));
  base::LogCapture log;
  const TypeRegistry types = TypeRegistry::load({tmp.file("one"), tmp.file("two")});
  expectConformance(
      types, {"com.example.raw < com.example.camera", "com.example.raw < public.data",
              "com.example.camera !< public.data", "com.example.a < com.example.c",
              "com.example.c < com.example.b", "com.example.b < public.item",
              "com.example.d < com.example.c", "com.example.a !< com.example.d",
              "com.example.self < com.example.self", "com.example.self !< public.item",
              "com.example.orphan < public.data", "com.example.orphan !< com.example.nowhere"});
  EXPECT_EQ(types.supertypes("com.example.b"),
            (Strings{"com.example.a", "com.example.b", "com.example.c", "public.content",
                     "public.data", "public.item", "public.text"}));
  EXPECT_FALSE(types.contains("com.example.nowhere"));
  EXPECT_EQ(log.lines(),
            Strings{"ignoring unknown parent types of com.example.orphan declared in " +
                    tmp.file("one/types.plist") + ": com.example.nowhere"});
}

TEST(TypeIdentifiers, UnusableFilesAndMalformedDeclarationsAreSkippedOneByOne) {
  const std::string tooLong(kMaxTypeIdentifierLength + 1, 'x');
  const std::pair<std::string, const char*> cases[] = {
      {"<string>com.example.x</string>", "it is not a dictionary"},
      {"<dict><key>conformsTo</key><array/></dict>", "identifier is missing or not a string"},
      {decl("bad id", {}), "bad id is not a valid type identifier"},
      {decl("com..example", {}), "is not a valid type identifier"},
      {decl(tooLong, {}), "is not a valid type identifier"},
      {decl("public.jpeg", {"public.text"}), "public.jpeg is already a built-in type"},
      {decl("com.example.good", {}), "com.example.good is already declared"},
      {"<dict><key>identifier</key><string>com.example.m1</string></dict>",
       "conformsTo is missing"},
      {"<dict><key>identifier</key><string>com.example.m2</string><key>conformsTo</key>"
       "<string>public.data</string></dict>",
       "conformsTo is not an array"},
      {decl("com.example.m3", {"public.data", "not valid"}),
       "conformsTo holds not valid, which is not a type identifier"},
      {decl("com.example.m4", Strings(kMaxTypeDeclarationListLength + 1, "public.data")),
       "conformsTo has more than 32 entries"},
      {decl("com.example.m5", {}, {"imagejpeg"}), "mimeTypes holds imagejpeg, which is not a MIME"},
      {decl("com.example.m6", {}, {}, {"a/b"}), "extensions holds a/b, which is not a filename"},
  };
  std::string entries = decl("com.example.good", {"public.data"});
  for (const auto& [entry, reason] : cases) entries += entry;
  entries += decl("com.example.last", {"com.example.good"});
  testing::TempDir tmp;
  const std::string path = tmp.write("sdk/types.plist", typesFile(entries));
  tmp.write("garbage/types.plist", "<plist><dict><key>x</key>");
  tmp.write("dictionary/types.plist", xmlPlist("<dict/>"));
  std::filesystem::create_directories(tmp.path() / "directory/types.plist");
  std::filesystem::create_directories(tmp.path() / "fifo");
  ASSERT_EQ(::mkfifo(tmp.file("fifo/types.plist").c_str(), 0600), 0);
  tmp.write("not-a-directory", "x");

  base::LogCapture log;
  const Strings unusable = {"garbage", "dictionary", "directory", "fifo"};
  Strings directories = {tmp.file("missing"), tmp.file("not-a-directory")};  // silent
  for (const std::string& name : unusable) directories.push_back(tmp.file(name));
  directories.push_back(tmp.file("sdk"));
  const TypeRegistry types = TypeRegistry::load(directories);
  EXPECT_TRUE(types.conformsTo("com.example.last", "public.data"));
  EXPECT_TRUE(types.conformsTo("public.jpeg", "public.image"));  // not redefined
  EXPECT_EQ(types.size(), TypeRegistry::load({}).size() + 2);
  const Strings lines = log.lines();
  ASSERT_EQ(lines.size(), unusable.size() + std::size(cases));
  for (size_t i = 0; i < unusable.size(); ++i) {
    const std::string prefix = "ignoring type declarations in " + tmp.file(unusable[i]) + "/";
    EXPECT_EQ(lines[i].rfind(prefix, 0), 0u) << lines[i];
  }
  for (size_t i = 0; i < std::size(cases); ++i) {
    const std::string& line = lines[unusable.size() + i];
    const std::string prefix =
        "ignoring type declaration " + std::to_string(i + 1) + " of " + path + ": ";
    EXPECT_EQ(line.rfind(prefix, 0), 0u) << line;
    EXPECT_NE(line.find(cases[i].second), std::string::npos) << line;
  }
}

TEST(TypeIdentifiers, DeclarationCountsAreBoundedAndLongChainsResolve) {
  // A chain longer than one file may hold: each type conforms to the one
  // before, so the last loaded one conforms to all of them.
  auto chain = [](const std::string& prefix, size_t count, const std::string& root) {
    std::string entries;
    for (size_t i = 0; i < count; ++i) {
      entries += decl(prefix + std::to_string(i), {i == 0 ? root : prefix + std::to_string(i - 1)});
    }
    return typesFile(entries);
  };
  testing::TempDir tmp;
  const size_t perFile = kMaxDeclaredTypesPerFile;
  const size_t inLast = kMaxDeclaredTypes - perFile - 1000;  // what the total leaves for c
  tmp.write("a/types.plist", chain("com.a.t", perFile + 3, "public.text"));
  tmp.write("b/types.plist", chain("com.b.t", 1000, "com.a.t0"));
  tmp.write("c/types.plist", chain("com.c.t", inLast + 5, "com.b.t999"));
  base::LogCapture log;
  const TypeRegistry types = TypeRegistry::load({tmp.file("a"), tmp.file("b"), tmp.file("c")});

  const std::string lastC = "com.c.t" + std::to_string(inLast - 1);
  EXPECT_TRUE(types.conformsTo("com.a.t" + std::to_string(perFile - 1), "public.item"));
  EXPECT_TRUE(types.conformsTo(lastC, "com.a.t0"));
  EXPECT_FALSE(types.conformsTo("com.a.t0", lastC));
  EXPECT_FALSE(types.contains("com.a.t" + std::to_string(perFile)));
  EXPECT_FALSE(types.contains("com.c.t" + std::to_string(inLast)));
  EXPECT_EQ(types.size(), TypeRegistry::load({}).size() + kMaxDeclaredTypes);
  const std::string from = "ignoring type declarations from entry ";
  EXPECT_EQ(log.lines(),
            (Strings{from + std::to_string(perFile) + " of " + tmp.file("a/types.plist") +
                         ": more than " + std::to_string(perFile) + " in one file",
                     from + std::to_string(inLast) + " of " + tmp.file("c/types.plist") +
                         ": more than " + std::to_string(kMaxDeclaredTypes) + " in all files"}));
}

TEST(TypeIdentifiers, SharedRegistryReloadsWhenAFileOrTheDirectoriesChange) {
  testing::TempDir tmp;
  tmp.write("first/types.plist", typesFile(decl("com.example.one", {"public.image"})));
  tmp.write("second/types.plist", typesFile(decl("com.example.other", {"public.text"})));
  ScopedEnvironment dirs("VANTREL_SDK_DIRS", tmp.file("first"));
  TypeRegistry::SharedPtr before = TypeRegistry::shared();
  EXPECT_TRUE(typeConformsTo("com.example.one", "public.data"));
  EXPECT_EQ(TypeRegistry::shared(), before);  // nothing changed: no reload

  tmp.write("first/types.plist",
            typesFile(decl("com.example.two", {"public.audio"}, {"audio/x-two"})));
  EXPECT_NE(TypeRegistry::shared(), before);
  EXPECT_FALSE(typeConformsTo("com.example.one", "public.data"));
  EXPECT_TRUE(typeConformsTo("com.example.two", "public.audiovisual-content"));
  EXPECT_EQ(typeForMimeType("audio/x-two"), "com.example.two");

  std::filesystem::remove(tmp.file("first/types.plist"));
  EXPECT_FALSE(typeConformsTo("com.example.two", "public.audio"));
  ScopedEnvironment both("VANTREL_SDK_DIRS", tmp.file("first") + ":" + tmp.file("second"));
  EXPECT_TRUE(typeConformsTo("com.example.other", "public.text"));
}

}  // namespace
}  // namespace vantrel::platform
