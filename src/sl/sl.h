// SL command execution: DMI management-interface commands run synchronously
// through the provider's entry point, and the library's set-up and teardown.
//
// Every command operation returns 0 on success and 1 on failure; the
// provider's status is read afterwards with SLCnfStatus (0 and 1 count as
// success).
#pragma once

#include <atomic>

#include "sl/sltypes.h"

extern "C" {

// The provider's entry point, exported by its client library. The library
// refers to it weakly: in a program linked without a provider it is null, and
// every command fails as in an uninitialised library.
uint32_t DmiInvoke(void* commandBlock);

typedef uint32_t (*SLInvokeFunction)(void* commandBlock);
// The entry point used for every command; null until SLInitialize.
extern SLInvokeFunction SLDmiInvoke;

int SLInitialize(void);
int SLCleanup(void);
// Ends the confirm wait of a command in progress (it fails) and makes every
// later command fail unsent, as SLCleanup does first; SLInitialize undoes it.
void SLAbandonCommands(void);
int SLSynchronousExecute(SLHandle* h);
// The confirm callback given to the provider: clears the pending word of the
// handle whose command block it receives; returns its argument.
void* dmiConfirmFunc(void* commandBlock);

int SLDmiRegisterMgmt(SLHandle* h, SLIndicationHandler handler);
int SLDmiUnregisterMgmt(SLHandle* h);
int SLCancel(SLHandle* h);

int SLListComponent(SLHandle* h, const char* filter, uint32_t component);
int SLListFirstComponent(SLHandle* h, const char* filter);
int SLListNextComponent(SLHandle* h, const char* filter, uint32_t component);
int SLListComponentDesc(SLHandle* h, uint32_t component);
int SLListGroup(SLHandle* h, uint32_t component, uint32_t group);
int SLListFirstGroup(SLHandle* h, uint32_t component);
int SLListNextGroup(SLHandle* h, uint32_t component, uint32_t group);
int SLListGroupDesc(SLHandle* h, uint32_t component, uint32_t group);
int SLListAttribute(SLHandle* h, uint32_t component, uint32_t group, uint32_t attribute);
int SLListFirstAttribute(SLHandle* h, uint32_t component, uint32_t group);
int SLListNextAttribute(SLHandle* h, uint32_t component, uint32_t group, uint32_t attribute);
int SLListAttributeDesc(SLHandle* h, uint32_t component, uint32_t group, uint32_t attribute);

int SLGetAttribute(SLHandle* h, uint32_t component, uint32_t group, uint32_t attribute, SLKeyList* keys);
int SLSetAttribute(SLHandle* h, uint32_t component, uint32_t group, uint32_t attribute, SLKeyList* keys,
                   unsigned size, const void* value);
int SLReserveAttribute(SLHandle* h, uint32_t component, uint32_t group, uint32_t attribute, SLKeyList* keys);
int SLReleaseAttribute(SLHandle* h, uint32_t component, uint32_t group, uint32_t attribute, SLKeyList* keys);

int SLGetRow(SLHandle* h, uint32_t component, uint32_t group, uint32_t attribute, SLKeyList* keys);
int SLGetFirstRow(SLHandle* h, uint32_t component, uint32_t group, uint32_t attribute, SLKeyList* keys);
// Issues 774, or 773 (first row) when keys is null.
int SLGetNextRow(SLHandle* h, uint32_t component, uint32_t group, uint32_t attribute, SLKeyList* keys);

int SLRegisterCi(SLHandle* h, uint32_t a, uint32_t b, uint32_t c, uint32_t n, const uint32_t* pairs);
int SLUnregisterCi(SLHandle* h, uint32_t x);
int SLCiInstallData(SLHandle* h, uint32_t component, const char* path);
int SLCiUninstallData(SLHandle* h, uint32_t component);

// Size in bytes of a DMI value of `type`; strings by their count.
unsigned SLAttributeSize(int type, const void* value);
}

// Set by SLIndicateDown; nothing in the library consults it.
extern std::atomic<int> SLLibDownFlag;
