#include "ZEL/pobject.h"
#include "tests/support/testing.h"

using ZEL::PObject;

namespace {

PObject Sample() {
    PObject sample;
    sample["a"] = 5;
    sample["b"].asArray().push_back("x");
    sample["b"].asArray().emplace_back();
    return sample;
}

}  // namespace

TEST(PObject, TellsItsTypeAndWhetherItIsEmptyOrTrue) {
    PObject map, array;
    map.asMap();
    array.asArray();
    const struct {
        PObject value;
        const char* type;
        bool empty, truth;
        const char* text;
    } cases[] = {
        {PObject(), "null", true, false, "null"},
        {PObject(0ULL), "integer", false, false, "0"},
        {PObject(ULLONG_MAX), "integer", false, true, "18446744073709551615"},
        {PObject(static_cast<const char*>(nullptr)), "string", true, false, "\"\""},
        {PObject("say \"hi\"\n"), "string", false, true, "\"say \"hi\"\n\""},
        {map, "map", true, false, "{}"},
        {array, "array", true, false, "[]"},
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
    PObject o(4294967296ULL);
    EXPECT_EQ(o.asString(), "0");
    o = 0x1ff80ff80ULL;
    EXPECT_EQ(o.asUInt8(), 0x80);
    EXPECT_EQ(o.asInt8(), -128);
    EXPECT_EQ(o.asInt16(), -128);
    EXPECT_EQ(o.asInt32(), -8323200);
    EXPECT_EQ(o.asInt64(), 0x1ff80ff80LL);
    o = -1;
    EXPECT_EQ(o.asUInt64(), ULLONG_MAX);
    EXPECT_EQ(PObject(-1).asInt64(), -1);
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
    EXPECT_EQ(PObject("5").asUInt64(), 0U);
    EXPECT_EQ(&sample["c"], &PObject::GetEmptyObject());
    EXPECT_EQ(&sample[UINT_MAX], &PObject::GetEmptyObject());
    EXPECT_EQ(sample[0].asUInt64(), 5U);
    EXPECT_EQ(sample["b"][0].asString(), "x");
}

TEST(PObject, WritingTurnsItIntoTheContainerButAnIndexThrowsOutsideAMap) {
    PObject o("text");
    o["x"] = 1;
    o[0] = 2;
    EXPECT_EQ(o.toString(), "{\"x\": 2}");
    EXPECT_TRUE(o.hasMember("x"));
    o.asArray().push_back(0);
    EXPECT_EQ(o.toString(), "[0]");
    PObject null, map = Sample();
    for (const auto& [object, index] : {std::pair{&map, 2U}, {&o, 0U}, {&null, 0U}}) {
        try {
            (*object)[index] = 1;
            FAIL() << "no exception";
        } catch (const std::out_of_range& e) {
            EXPECT_STREQ(e.what(), "out_of_range: PObject::operator[]");
        }
    }
}

TEST(PObject, CopiesAreDeepAndMovesAndSelfAssignmentLeaveNull) {
    PObject original = Sample();
    PObject copied = original;
    copied["b"].asArray().clear();
    EXPECT_EQ(original.toString(), Sample().toString());
    PObject moved = std::move(copied);
    EXPECT_TRUE(copied.isNull());  // NOLINT(bugprone-use-after-move): null is what a move leaves
    moved.swap(original);
    EXPECT_EQ(original.toString(), "{\"a\": 5, \"b\": []}");
    PObject& same = original;
    original = same;
    EXPECT_TRUE(original.isNull());
    moved = 5;
    PObject& itself = moved;
    moved = std::move(itself);
    EXPECT_TRUE(moved.isNull());
}

TEST(PObject, APartOfItselfCanBeAssignedToIt) {
    PObject o = Sample();
    o = o["b"];
    o = std::as_const(o).asArray();
    EXPECT_EQ(o.toString(), "[\"x\", null]");
    o = std::move(o.asArray()[0]);
    EXPECT_EQ(o.toString(), "\"x\"");
    o[std::string(100, 'k')] = std::string(100, 'v');
    o = o[0].asString();
    EXPECT_EQ(o.asString(), std::string(100, 'v'));
}

TEST(PObject, AnyDepthIsCopiedPrintedAndFreedWithoutRecursion) {
    for (const bool maps : {false, true}) {
        PObject deep;
        for (int i = 0; i < 100000; ++i) {
            PObject outer;
            (maps ? outer["value"] : outer.asArray().emplace_back()) = std::move(deep);
            deep = std::move(outer);
        }
        PObject copied = deep;
        EXPECT_EQ(copied.toString(), deep.toString());
        copied = PObject("replaced");
    }
}
