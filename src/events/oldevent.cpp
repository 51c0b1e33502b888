#include "events/oldevent.h"

void ZorekEventActions(SLHandle*)
{
}
