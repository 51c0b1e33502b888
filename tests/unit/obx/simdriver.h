// The one driver fixture of the unit tests: the OBX module talks to the
// simulated driver and controller, whose record of requests and log lines the
// tests read. Each test starts from a never-opened device.
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
        forgetDevice();
        obxsimReset();
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
    static bool logged(const std::string& line)
    {
        std::vector<std::string> log = obxsimLog();
        return std::find(log.begin(), log.end(), line) != log.end();
    }
    // The log without the device's opening and identification and without
    // the expiries, which come on the controller's own time.
    static std::string actions()
    {
        std::string out;
        for (const std::string& line : obxsimLog())
            if (line != "get device id" && line.rfind("open /dev/obx", 0) != 0 && line.rfind("watchdog expired", 0) != 0)
                out += line + "; ";
        return out;
    }
    static std::vector<ObxSimRequest> requestsFor(uint8_t netFunction, uint8_t command)
    {
        std::vector<ObxSimRequest> found;
        for (const ObxSimRequest& request : obxsimRequests())
            if (request.netFunction == netFunction && request.command == command)
                found.push_back(request);
        return found;
    }
};
