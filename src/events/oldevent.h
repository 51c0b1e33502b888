// Vendor ("Zorek|Error") event matching.
#pragma once

#include "sl/sltypes.h"

void ZorekEventActions(SLHandle* indication);
