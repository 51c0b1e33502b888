// Delivery of the provider's indications to the application's handler.
#pragma once

#include "sl/sltypes.h"

extern "C" {
void SLEventInitialize(void);
void SLEventCleanup(void);
// Installs `handler`; with null, waits until no event thread is running.
void SLEventSetHandler(SLIndicationHandler handler);
// The indication callback handed to the provider by the register command.
// Copies the indication into a handle and runs the handler on an event thread
// of its own (64 KiB stack); without a handler, or when the indication's
// stated length is below its 52-byte header or above 1 MiB, it is completed at
// once and dropped.
void SLIndicationFunc(void* indication);
// Runs the handler (if one is still installed) on the handle, completes the
// indication and frees the handle.
void* SLEventThread(void* handle);
// Removes the handler and waits until no call of SLIndicationFunc is under
// way and every event thread started has finished; later calls find no
// handler and touch no SL memory. SLCleanup calls it first: a provider may
// still be delivering an indication when the unregister command has been
// confirmed, and an event thread frees its handle when it ends.
void slEventQuiesce(void);
}

// An event indication (type 1) of `component` made of rows read from the
// provider, for a process that explains an event instead of receiving it:
// class i is named by the DMI string `classes[i]` and carries the row that the
// row command's confirm in `rows[i]` holds, with its keys and values. Laid out
// as the provider delivers one and held as SLIndicationFunc holds a delivered
// one, so the worker and the matchers read it alike. A new handle (the caller
// destroys it), or null when memory runs out.
SLHandle* slMakeEventIndication(uint32_t component, const DmiString* const* classes, SLHandle* const* rows,
                                uint32_t count);
