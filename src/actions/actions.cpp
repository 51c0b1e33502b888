#include "actions/actions.h"

void LogEvent(SLHandle*, EventRecord*)
{
}
