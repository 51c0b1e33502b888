// Operating-system services and the configuration file.
#pragma once

#include <cstdint>

// 1: notifications only, no system-control action is carried out.
extern uint32_t bNotificationOnly;

int MoxOsSpecificInit(void);
int MoxSemaphoreWait(void);
int MoxSemaphoreRelease(void);
// Sleeps whole seconds: milliseconds / 1000, at least 1.
void MoxDelay(int32_t milliseconds);
// Replaces the process with "/sbin/init 0"; returns only on failure.
int MoxShutDownOs(void);
int GetOSType(void);
// "/usr/local/ubo/bin/mox.cfg", the configuration file.
extern const char* const MoxConfigFile;
// Reads "/usr/local/ubo/bin/mox.cfg"; 1 when read, 0 when it cannot be opened.
int ProcessCfgOption(void);

// The same work on files of the caller's choosing.
int processCfgFile(const char* path);
int shutDownOsWith(const char* program);
