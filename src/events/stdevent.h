// Standard DMI event matching.
#pragma once

#include "sl/sltypes.h"

void StdEventActions(SLHandle* indication);
