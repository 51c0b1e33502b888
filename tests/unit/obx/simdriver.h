// Points the OBX module at the simulated driver for one test and puts the
// interface's process-wide state back to "never opened".
#pragma once

#include <gtest/gtest.h>

#include <algorithm>
#include <string>
#include <vector>

#include "obx/obxapi.h"
#include "obxdrv/obxsim.h"

inline void* simMmap(void* address, size_t length, int protection, int flags, int fd, off_t offset)
{
    return obxsimMmap(address, length, protection, flags, fd, static_cast<int64_t>(offset));
}

inline const ObxOs simOs = {obxsimOpen, obxsimIoctl, simMmap, obxsimMunmap, obxsimClose};

class SimDriverTest : public ::testing::Test {
protected:
    void SetUp() override
    {
        obxsimReset();
        forgetDevice();
        obxSetOs(&simOs);
    }
    void TearDown() override
    {
        forgetDevice();
        obxSetOs(nullptr);
    }
    static void forgetDevice()
    {
        if (hDevice1 != 0)
            obxsimClose(hDevice1);
        hDevice1 = 0;
        IpmiVersion = 0;
        AsyncEventHandle = 0;
        NTstatus[0] = NTstatus[1] = 0;
    }
    static size_t countLog(const std::string& line)
    {
        std::vector<std::string> log = obxsimLog();
        return static_cast<size_t>(std::count(log.begin(), log.end(), line));
    }
    // Requests with the given net function and command.
    static std::vector<ObxSimRequest> requestsFor(uint8_t netFunction, uint8_t command)
    {
        std::vector<ObxSimRequest> found;
        for (const ObxSimRequest& request : obxsimRequests())
            if (request.netFunction == netFunction && request.command == command)
                found.push_back(request);
        return found;
    }
};
