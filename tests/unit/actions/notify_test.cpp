#include <gtest/gtest.h>

#include <cstring>
#include <string>

#include "actions/actions.h"
#include "sl/slhandle.h"
#include "sl/slstring.h"

namespace {

// Without a provider every lookup fails: the texts fall back as they would
// for rows and groups the provider cannot list.
TEST(RowLabel, FallsBackToTheFirstKeyOrNotApplicable)
{
    uint32_t value = 42;
    int32_t negative = -7;
    SLKeyList withValue{};
    withValue.count = 1;
    withValue.keys[0] = {1, 5, &value};
    SLKeyList negativeValue{};
    negativeValue.count = 2;
    negativeValue.keys[0] = {1, 5, &negative};
    SLKeyList withoutValue{};
    withoutValue.count = 1;
    withoutValue.keys[0] = {1, 5, nullptr};
    SLKeyList empty{};
    struct Case {
        SLKeyList* keys;
        const char* label;
    } cases[] = {
        {nullptr, "Not Applicable"}, {&withValue, "42"}, {&negativeValue, "-7"},
        {&withoutValue, "Not Applicable"}, {&empty, "Not Applicable"},
    };
    SLHandle* handle = SLCreateHandle(0);
    for (const Case& c : cases) {
        EventRecord record{};
        record.componentId = 3;
        record.groupId = 4;
        record.keyList = c.keys;
        char label[64];
        rowLabel(handle, &record, label, sizeof label);
        EXPECT_STREQ(label, c.label);
    }
    SLDestroyHandle(handle);
}

TEST(EventMessage, AbsentTextsAndLongNames)
{
    EventRecord standard{};
    standard.eventKind = EVENT_STANDARD;
    char* message = createEventMessage(&standard);
    EXPECT_STREQ(message, "Event type \"Unknown\" reported for \"Unknown\" group.");
    SLDeleteString(message);

    std::string longName(3000, 'g');
    EventRecord vendor{};
    vendor.eventKind = EVENT_VENDOR;
    vendor.groupName = longName.c_str();
    message = createEventMessage(&vendor);
    ASSERT_NE(message, nullptr);
    EXPECT_EQ(std::strlen(message), 1023u) << "cut to the 1024-byte message";
    EXPECT_EQ(std::string(message).rfind("Event reported for Unknown attribute in the ggg", 0), 0u);
    SLDeleteString(message);
}

TEST(Dispatch, OnlyNonZeroSwitchesAndKnownCodesRun)
{
    static std::string calls;
    static const ActionEntry table[] = {
        {8, [](SLHandle*, EventRecord*) { calls += "8 "; return 0; }},
        {8, [](SLHandle*, EventRecord*) { calls += "second "; return 0; }},
        {20, [](SLHandle*, EventRecord*) { calls += "20 "; return 0; }},
        {0, nullptr},
    };
    const ActionEntry* saved = actionsSetHandlers(table);
    EventRecord record{};
    DoAction(8, 0, nullptr, &record);  // switched off
    DoAction(8, 1, nullptr, &record);  // first match only
    DoAction(20, 5, nullptr, &record); // any non-zero value
    DoAction(17, 1, nullptr, &record); // the alert name is no action
    DoAction(99, 1, nullptr, &record);
    actionsSetHandlers(saved);
    EXPECT_EQ(calls, "8 20 ");
}

TEST(Dispatch, TablesHoldTheFifteenActionsInRunOrder)
{
    std::string order;
    for (const ActionOrder* e = ActionID; e->code != 0; ++e) {
        EXPECT_EQ(e->position, e->code - 7) << e->code;
        order += std::to_string(e->code) + " ";
    }
    EXPECT_EQ(order, "8 7 9 10 16 20 19 21 22 11 12 13 14 15 18 ");
    int handlers = 0;
    for (const ActionEntry* e = lscActions; e->code != 0; ++e, ++handlers)
        EXPECT_NE(e->code, 17u);
    EXPECT_EQ(handlers, 15);
}

} // namespace
