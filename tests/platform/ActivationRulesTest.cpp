#include "platform/ActivationRules.h"

#include <gtest/gtest.h>

#include <cmath>
#include <string>
#include <vector>

#include "tests/support/TempDir.h"

namespace vantrel::platform {
namespace {

using lmo::Array;
using lmo::Dictionary;
using lmo::Value;
using enum ActivationRuleVerdict;
using Strings = std::vector<std::string>;

Value n(int64_t i) {
  return Value::integer(i);
}
Value real(double d) {
  return Value::real(d);
}
Value rule(std::initializer_list<Dictionary::Entry> entries) {
  return Value(Dictionary(entries));
}
Value itemsOf(std::vector<Value> items) {
  return Value(Dictionary{{"items", Value(Array(items))}});
}
Value item(Value attachments) {
  return Value(Dictionary{{"attachments", attachments}});
}

// Extension items, one per list, each with those attachments.
Value items(std::initializer_list<Strings> attachments) {
  std::vector<Value> list;
  for (const Strings& types : attachments) {
    list.push_back(item(Array(std::vector<Value>(types.begin(), types.end()))));
  }
  return itemsOf(list);
}

// One item carrying `count` JPEGs.
Value jpegs(size_t count) {
  return items({Strings(count, "public.jpeg")});
}

// A rule of `types` + 1 types: com.example.t<i> and public.jpeg, one of each.
Value manyTypes(size_t types) {
  std::vector<Dictionary::Entry> entries{{"public.jpeg", n(1)}};
  for (size_t i = 0; i < types; ++i)
    entries.emplace_back("com.example.t" + std::to_string(i), n(1));
  return Value(Dictionary::fromEntries(entries));
}

struct Case {
  Value rule;
  Value items;
  ActivationRuleVerdict expected;
};

void expectVerdicts(const TypeRegistry& types, const std::vector<Case>& cases) {
  for (const Case& c : cases) {
    EXPECT_STREQ(describe(evaluateActivationRule(c.rule, c.items, types)), describe(c.expected))
        << lmo::describe(c.rule) << " / " << lmo::describe(c.items).substr(0, 200);
    EXPECT_EQ(activationRuleAdmits(c.rule, c.items, types), c.expected == kAdmitted);
  }
}

TEST(ActivationRules, CountsMaxItemsAndConformance) {
  const Value image2 = rule({{"public.image", n(2)}});
  const Value max2 = rule({{"maxItems", n(2)}, {"public.image", n(9)}});
  expectVerdicts(
      TypeRegistry::load({}),
      {{image2, items({{"public.jpeg", "public.png"}}), kAdmitted},
       {image2, items({{"public.jpeg"}, {"public.png"}, {"public.gif"}}), kCountExceeded},
       {rule({{"public.data", n(3)}}),
        items({{"public.jpeg", "public.html", "public.zip-archive"}}), kAdmitted},
       {rule({{"public.image", n(1)}, {"public.text", n(1)}}),
        items({{"public.jpeg"}, {"public.html"}}), kAdmitted},
       {image2, items({{"public.jpeg", "public.pdf"}}), kUnmatchedAttachment},
       {rule({{"public.jpeg", n(1)}}), items({{"public.image"}}), kUnmatchedAttachment},
       // One JPEG counts against both types.
       {rule({{"public.image", n(1)}, {"public.jpeg", n(2)}}), jpegs(2), kCountExceeded},
       {rule({{"public.image", n(2)}, {"public.jpeg", n(1)}}), jpegs(2), kCountExceeded},
       {rule({{"public.image", n(2)}, {"public.jpeg", n(1)}}),
        items({{"public.jpeg"}, {"public.jpeg"}}), kCountExceeded},
       {rule({{"public.image", n(2)}, {"public.jpeg", n(1)}}),
        items({{"public.jpeg", "public.png"}}), kAdmitted},
       {rule({{"public.image", n(0)}}), jpegs(1), kCountExceeded},
       {rule({{"public.image", n(0)}}), items({{}}), kAdmitted},
       {rule({{"com.example.x", n(1)}}), items({{"com.example.x"}}), kAdmitted},
       {max2, items({{"public.png"}, {"public.png"}}), kAdmitted},
       {max2, items({{"public.png"}, {"public.png"}, {}}), kTooManyItems},
       {rule({{"maxItems", n(0)}}), itemsOf({Value(Dictionary{})}), kTooManyItems},
       {rule({{"maxItems", n(0)}, {"public.item", n(0)}}), itemsOf({}), kAdmitted},
       {rule({}), jpegs(1), kUnmatchedAttachment},
       {image2, itemsOf({Value(Dictionary{{"title", "x"}})}), kAdmitted},
       {rule({{"public.image", real(2.0)}}), jpegs(2), kAdmitted},
       {rule({{"public.image", real(2.0)}}), jpegs(3), kCountExceeded},
       {rule({{"public.image", real(1e300)}}), jpegs(3), kAdmitted},
       {rule({{"public.image", Value::unsignedInteger(UINT64_MAX)}}), jpegs(3), kAdmitted}});
}

TEST(ActivationRules, MalformedShapesAndBoundsAreRefused) {
  const Value image = rule({{"public.image", n(5)}});
  const Value jpeg = jpegs(1);
  const std::string longType(kMaxTypeIdentifierLength + 1, 't');
  const std::vector<Value> bare(kMaxExtensionItems, Value(Dictionary{}));
  const Value mostAttachments = rule({{"public.jpeg", n(kMaxExtensionAttachments)}});
  const size_t half = kMaxExtensionAttachments / 2;
  expectVerdicts(
      TypeRegistry::load({}),
      {{Value("public.image"), jpeg, kMalformedRule},
       {rule({{"public.image", real(1.5)}}), jpeg, kMalformedRule},
       {rule({{"public.image", n(-1)}}), jpeg, kMalformedRule},
       {rule({{"public.image", real(NAN)}}), jpeg, kMalformedRule},
       {rule({{"public.image", Value::boolean(true)}}), jpeg, kMalformedRule},
       {rule({{"public.image", "2"}}), jpeg, kMalformedRule},
       {rule({{"maxItems", n(-1)}, {"public.image", n(1)}}), jpeg, kMalformedRule},
       {rule({{"", n(1)}}), jpeg, kMalformedRule},
       {rule({{longType, n(1)}}), jpeg, kMalformedRule},
       {Value(), Value(), kMalformedRule},  // the rule is judged first
       {image, Value(Array{jpeg}), kMalformedItems},
       {image, Value(Dictionary{}), kMalformedItems},
       {image, Value(Dictionary{{"items", jpeg}}), kMalformedItems},
       {image, itemsOf({Value("public.jpeg")}), kMalformedItems},
       {image, itemsOf({item("public.jpeg")}), kMalformedItems},
       {image, itemsOf({item(Array{n(1)})}), kMalformedItems},
       {rule({{"public.item", n(5)}}), items({{longType}}), kMalformedItems},
       // The whole input is read before anything is evaluated.
       {image, itemsOf({item(Array{"public.pdf"}), Value("x")}), kMalformedItems},
       {image, itemsOf(bare), kAdmitted},
       {image, itemsOf(std::vector<Value>(kMaxExtensionItems + 1, Value(Dictionary{}))),
        kOverLimit},
       {mostAttachments, jpegs(kMaxExtensionAttachments), kAdmitted},
       {mostAttachments, items({Strings(half, "public.jpeg"), Strings(half + 1, "public.jpeg")}),
        kOverLimit},
       {manyTypes(kMaxActivationRuleTypes - 1), jpeg, kAdmitted},
       {manyTypes(kMaxActivationRuleTypes), jpeg, kOverLimit}});
}

TEST(ActivationRules, DeclaredTypesTakePartThroughTheRegistryGiven) {
  testing::TempDir tmp;
  tmp.write("sdk/types.plist",
            "<plist version=\"1.0\"><array><dict><key>identifier</key>"
            "<string>com.example.photo</string><key>conformsTo</key><array>"
            "<string>public.jpeg</string></array></dict></array></plist>");
  const Value imageRule = rule({{"public.image", n(1)}});
  const Value photo = items({{"com.example.photo"}});
  EXPECT_TRUE(activationRuleAdmits(imageRule, photo, TypeRegistry::load({tmp.file("sdk")})));
  EXPECT_FALSE(activationRuleAdmits(imageRule, photo, TypeRegistry::load({})));
}

}  // namespace
}  // namespace vantrel::platform
