#include "mif/basebrd.h"

#include "mif/format.h"
#include "sl/slmap.h"

namespace {
constexpr int rowNameSize = 64;
}

int BaseboardRowName(SLHandle* h, uint32_t componentId, uint32_t groupId, SLKeyList* keys, char* buffer)
{
    uint32_t attribute = SLMapAttributeNameToId(componentId, groupId, "Short Name");
    if (attribute == 0)
        attribute = SLMapAttributeNameToId(componentId, groupId, "Description");
    if (attribute == 0)
        return noValue(buffer, rowNameSize);
    return GetPureValue(h, componentId, groupId, attribute, keys, buffer, rowNameSize);
}
