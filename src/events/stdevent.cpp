#include "events/stdevent.h"

void StdEventActions(SLHandle*)
{
}
