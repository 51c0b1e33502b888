// Name and identifier mapping by walking the provider's lists, and MIF
// installation.
#pragma once

#include <cstddef>

#include "sl/sltypes.h"

extern "C" {
uint32_t SLMapComponentNameToId(const char* name);
uint32_t SLMapGroupNameToId(uint32_t component, const char* name);
uint32_t SLMapClassNameToId(uint32_t component, const char* className);
uint32_t SLMapAttributeNameToId(uint32_t component, uint32_t group, const char* name);
// New SL strings; the caller deletes them with SLDeleteString.
char* SLMapComponentIdToName(uint32_t component);
char* SLMapGroupIdToName(uint32_t component, uint32_t group);
char* SLMapAttributeIdToName(uint32_t component, uint32_t group, uint32_t attribute);
int IsExactMatch(const DmiString* d, const char* s);
int PrefixMatches(const DmiString* d, const char* s);
// Installs `file` from the MIF directory ("UXDMIPATH", else "/var/dmi/mifs/backup").
int SLInstallMIF(SLHandle* h, const char* file);
int SLGetInstalledMIFVersion(SLHandle* h, const char* name, float* version);
}

// The path SLInstallMIF gives the provider for `file`, in `out`; false when it
// does not fit.
bool slMifPath(const char* file, char* out, size_t size);
// The installed version of component `c`'s MIF, read as SLGetInstalledMIFVersion
// reads it for a component found by name: 0, or 1 when it cannot be read.
int slInstalledMifVersionOf(SLHandle* h, uint32_t c, float* version);
