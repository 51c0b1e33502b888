// The record of one event, built by the matchers (and by the worker for an
// event of unknown class) and passed with the indication to every action.
#pragma once

#include <cstdint>

#include "sl/sltypes.h"

enum : uint32_t {
    EVENT_STANDARD = 1, // class "EventGeneration|..."
    EVENT_VENDOR = 2,   // class "Zorek|Error..."
    EVENT_UNKNOWN = 3,
};

// Texts belong to the catalogue (or are its constant fallback texts) and may
// be null. The key list belongs to the builder. The record lives on the
// builder's stack for one dispatch; handlers must not keep it.
struct EventRecord {
    uint32_t eventKind;
    uint32_t componentId;
    uint32_t groupId;
    uint32_t attributeId;
    uint32_t attributeValue;
    uint32_t errorState;
    SLKeyList* keyList;
    uint32_t eventGroupId;
    uint32_t eventType;
    uint32_t severity;
    uint32_t eventSystem;
    uint32_t eventSubsystem;
    const char* componentName;
    const char* groupName;
    const char* attributeName;
    const char* eventTypeText;
    const char* severityText;
    const char* systemText;
    const char* subsystemText;
    const char* attribute8Text;
};
static_assert(sizeof(EventRecord) == 80, "twenty 32-bit fields");
