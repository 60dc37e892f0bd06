// The in-memory patrol record and its preset list.
#include <gtest/gtest.h>

#include "fake/fake_host.h"
#include "patrol/patrol.h"

namespace {

PRESET_INFO Preset(int position, const std::string& name) {
    PRESET_INFO p;
    p.position = position;
    p.name = name;
    return p;
}

TEST(PatrolRecord, ConstructorsSetFieldsAndTouchNothing) {
    fake::Reset();
    Patrol empty;
    EXPECT_EQ(empty.GetId(), 0);
    EXPECT_EQ(empty.GetCamId(), 0);
    EXPECT_EQ(empty.GetName(), "");
    EXPECT_EQ(empty.GetStayTime(), 0);
    EXPECT_EQ(empty.GetPresetListNum(), 0);

    Patrol p(5, "gate", 10);
    EXPECT_EQ(p.GetId(), 0);
    EXPECT_EQ(p.GetCamId(), 5);
    EXPECT_EQ(p.GetName(), "gate");
    EXPECT_EQ(p.GetStayTime(), 10);
    EXPECT_EQ(p.GetPresetListNum(), 0);

    Patrol none(0);  // no load for ids below 1
    Patrol negative(-4);
    EXPECT_EQ(none.GetId(), 0);
    EXPECT_EQ(negative.GetName(), "");
    EXPECT_TRUE(fake::Statements().empty());
    EXPECT_TRUE(fake::CameraCalls().empty());
}

TEST(PatrolRecord, PresetListAddsReadsAndRefusesBadIndexes) {
    Patrol p;
    EXPECT_EQ(p.AddPresetToList(Preset(3, "door")), 0);
    EXPECT_EQ(p.AddPresetToList(Preset(8, "yard")), 1);
    EXPECT_EQ(p.GetPresetListNum(), 2);

    PRESET_INFO out = Preset(-1, "untouched");
    EXPECT_EQ(p.GetPresetFromList(1, &out), 0);
    EXPECT_EQ(out.position, 8);
    EXPECT_EQ(out.name, "yard");

    PRESET_INFO keep = Preset(-1, "untouched");
    EXPECT_EQ(p.GetPresetFromList(2, &keep), -1);
    EXPECT_EQ(p.GetPresetFromList(-1, &keep), -1);
    EXPECT_EQ(p.GetPresetFromList(0, nullptr), -1);
    EXPECT_EQ(keep.position, -1);
    EXPECT_EQ(keep.name, "untouched");

    p.DelAllPreset();
    EXPECT_EQ(p.GetPresetListNum(), 0);
}

TEST(PatrolRecord, CopiesAreIndependentAndNamesKeepTheirLengthInMemory) {
    Patrol a(1, "a", 2);
    for (int i = 0; i < 3; ++i) a.AddPresetToList(Preset(i, "p"));
    Patrol b = a;
    b.AddPresetToList(Preset(9, "extra"));
    b.SetName("b");
    EXPECT_EQ(a.GetPresetListNum(), 3);
    EXPECT_EQ(a.GetName(), "a");
    EXPECT_EQ(b.GetPresetListNum(), 4);

    a.SetName(std::string(300, 'x'));
    a.SetCamId(7);
    a.SetStayTime(-3);
    EXPECT_EQ(a.GetName().size(), 300u);
    EXPECT_EQ(a.GetCamId(), 7);
    EXPECT_EQ(a.GetStayTime(), -3);
}

}  // namespace
