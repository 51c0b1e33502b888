#include "events/alert.h"

int IssueOrRegisterAlert(const char*, EventRecord*, int)
{
    return 1;
}

int RegisterAllAlerts(void)
{
    return 0;
}

int AlertServiceInitialize(void)
{
    return 0;
}

int AlertServiceCleanup(void)
{
    return 0;
}
