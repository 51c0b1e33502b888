// Delivery of the provider's indications to the application's handler.
#pragma once

#include "sl/sltypes.h"

extern "C" {
void SLEventInitialize(void);
void SLEventCleanup(void);
// Installs `handler`; with null, waits until no event thread is running.
void SLEventSetHandler(SLIndicationHandler handler);
// The indication callback handed to the provider by the register command.
void SLIndicationFunc(void* indication);
void* SLEventThread(void* handle);
}
