#include "ZEL/pobject.h"

#include <gtest/gtest.h>

#include <climits>
#include <stdexcept>
#include <utility>

using ZEL::PObject;

namespace {

PObject Sample() {
    PObject sample;
    sample["a"] = 5;
    sample["b"].asArray().push_back("x");
    sample["b"].asArray().emplace_back();
    return sample;
}

PObject Nested(int levels, bool maps) {
    PObject value;
    for (int i = 0; i < levels; ++i) {
        PObject outer;
        if (maps) {
            outer["scalar before"] = "text";
            outer["value"] = std::move(value);
        } else {
            outer.asArray().push_back(std::move(value));
            outer.asArray().push_back("scalar after");
        }
        value = std::move(outer);
    }
    return value;
}

}  // namespace

TEST(PObject, TellsItsTypeAndWhetherItIsEmptyOrTrue) {
    PObject map, array, full_array;
    map.asMap();
    array.asArray();
    full_array.asArray().resize(1);
    const struct {
        PObject value;
        const char* type;
        bool empty, truth;
        const char* text;
    } cases[] = {
        {PObject(), "null", true, false, "null"},
        {PObject(0ULL), "integer", false, false, "0"},
        {PObject(ULLONG_MAX), "integer", false, true, "18446744073709551615"},
        {PObject(""), "string", true, false, "\"\""},
        {PObject(static_cast<const char*>(nullptr)), "string", true, false, "\"\""},
        {PObject("0"), "string", false, true, "\"0\""},
        {PObject("say \"hi\"\n"), "string", false, true, "\"say \"hi\"\n\""},
        {map, "map", true, false, "{}"},
        {array, "array", true, false, "[]"},
        {full_array, "array", false, true, "[null]"},
        {Sample(), "map", false, true, "{\"a\": 5, \"b\": [\"x\", null]}"},
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(c.text);
        const std::string type = c.type;
        EXPECT_EQ(c.value.isNull(), type == "null");
        EXPECT_EQ(c.value.isInteger(), type == "integer");
        EXPECT_EQ(c.value.isString(), type == "string");
        EXPECT_EQ(c.value.isMap(), type == "map");
        EXPECT_EQ(c.value.isArray(), type == "array");
        EXPECT_EQ(c.value.isContainer(), type == "map" || type == "array");
        EXPECT_EQ(c.value.isPrimitive(), type == "integer" || type == "string");
        EXPECT_EQ(c.value.isEmpty(), c.empty);
        EXPECT_EQ(c.value.asBool(), c.truth);
        EXPECT_EQ(c.value.toString(), c.text);
    }
}

TEST(PObject, IntegersAreCutToTheWidthThatIsAskedFor) {
    PObject o(4294967297ULL);
    EXPECT_EQ(o.asString(), "1");
    o = 4294967296ULL;
    EXPECT_EQ(o.asString(), "0");
    o = 257;
    EXPECT_EQ(o.asUInt8(), 1);
    o = 0x1ff80ff80ULL;
    EXPECT_EQ(o.asInt8(), -128);
    EXPECT_EQ(o.asInt16(), -128);
    EXPECT_EQ(o.asInt32(), -8323200);
    EXPECT_EQ(o.asInt64(), 0x1ff80ff80LL);
    o = -1;
    EXPECT_EQ(o.asUInt64(), ULLONG_MAX);
    EXPECT_EQ(o.asInt64(), -1);
    EXPECT_EQ(PObject(-1).asUInt64(), ULLONG_MAX);
    o = -2L;
    EXPECT_EQ(o.asInt64(), -2);
    o = 4294967295U;
    EXPECT_EQ(o.asUInt64(), 4294967295U);
    o = true;
    EXPECT_EQ(o.toString(), "1");
}

TEST(PObject, ReadingTheWrongTypeGivesTheSharedEmpties) {
    for (const PObject& o : {PObject(), PObject(7), PObject("text")}) {
        EXPECT_EQ(&o["key"], &PObject::GetEmptyObject());
        EXPECT_EQ(&o[0], &PObject::GetEmptyObject());
        EXPECT_EQ(&o.asMap(), &PObject::GetEmptyMap());
        EXPECT_EQ(&o.asArray(), &PObject::GetEmptyArray());
        EXPECT_FALSE(o.hasMember("key"));
    }
    const PObject sample = Sample();
    EXPECT_EQ(sample.asUInt64(), 0U);
    EXPECT_EQ(sample.asString(), "");
    EXPECT_EQ(PObject("5").asUInt64(), 0U);
    EXPECT_EQ(&sample["c"], &PObject::GetEmptyObject());
    EXPECT_EQ(&sample[2], &PObject::GetEmptyObject());
    EXPECT_EQ(&sample[UINT_MAX], &PObject::GetEmptyObject());
    EXPECT_EQ(sample[0].asUInt64(), 5U);
    EXPECT_EQ(sample["b"][0].asString(), "x");
    EXPECT_EQ(&sample["b"][2], &PObject::GetEmptyObject());
}

TEST(PObject, WritingTurnsTheObjectIntoTheContainer) {
    PObject o("text");
    o["x"] = 1;
    EXPECT_EQ(o.toString(), "{\"x\": 1}");
    EXPECT_TRUE(o.hasMember("x"));
    o[0] = 2;
    EXPECT_EQ(o["x"].asUInt64(), 2U);
    o.asArray().push_back(0);
    EXPECT_EQ(o.toString(), "[0]");
    o.asMap();
    EXPECT_EQ(o.toString(), "{}");
}

TEST(PObject, IndexForWritingThrowsForAllButTheEntriesOfAMap) {
    PObject map = Sample();
    PObject array = map["b"];
    PObject null;
    for (const auto& [object, index] : {std::pair{&map, 2U}, {&array, 0U}, {&null, 0U}}) {
        try {
            (*object)[index] = 1;
            FAIL() << "no exception";
        } catch (const std::out_of_range& e) {
            EXPECT_STREQ(e.what(), "out_of_range: PObject::operator[]");
        }
    }
}

TEST(PObject, CopiesAreDeepAndMovesLeaveNull) {
    PObject original = Sample();
    PObject copied = original;
    copied["b"].asArray().clear();
    EXPECT_EQ(original.toString(), Sample().toString());
    PObject moved = std::move(copied);
    EXPECT_TRUE(copied.isNull());  // NOLINT(bugprone-use-after-move): null is what a move leaves
    EXPECT_EQ(moved.toString(), "{\"a\": 5, \"b\": []}");
    moved.swap(original);
    EXPECT_EQ(moved.toString(), Sample().toString());
    original = moved.asMap();
    EXPECT_EQ(original.toString(), moved.toString());
}

TEST(PObject, AssigningItToItselfLeavesItNull) {
    PObject o = Sample();
    PObject& same = o;
    o = same;
    EXPECT_TRUE(o.isNull());
    o = Sample();
    o = std::move(same);
    EXPECT_TRUE(o.isNull());
}

TEST(PObject, APartOfItselfCanBeAssignedToIt) {
    PObject o = Sample();
    o = o["b"];
    EXPECT_EQ(o.toString(), "[\"x\", null]");
    o = std::as_const(o).asArray();
    EXPECT_EQ(o.toString(), "[\"x\", null]");
    o = std::move(o.asArray()[0]);
    EXPECT_EQ(o.toString(), "\"x\"");
    o = std::string(100, 'k');
    o[o.asString()] = "entry";
    o = o[0].asString();
    EXPECT_EQ(o.toString(), "\"entry\"");
}

TEST(PObject, AnyDepthIsCopiedPrintedAndFreedWithoutRecursion) {
    constexpr int kLevels = 100000;
    for (const bool maps : {false, true}) {
        const PObject deep = Nested(kLevels, maps);
        PObject copied = deep;
        EXPECT_EQ(copied.toString().size(), deep.toString().size());
        EXPECT_GT(copied.toString().size(), size_t{kLevels} * 10);
        copied = PObject("replaced");
    }
}
