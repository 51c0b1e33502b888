// The one driver fixture of the unit tests: the OBX module talks to the
// simulated driver and controller, whose record of requests and log lines the
// tests read. Each test starts from a never-opened device.
#pragma once

#include <gtest/gtest.h>

#include "obx/obxapi.h"
#include "obxdrv/obxsim.h"

inline const ObxOs simOs = {obxsimOpen, obxsimIoctl, [](void* address, size_t length, int protection, int flags, int fd,
    off_t offset) { return obxsimMmap(address, length, protection, flags, fd, static_cast<int64_t>(offset)); },
    obxsimMunmap, obxsimClose};

class SimDriverTest : public ::testing::Test {
protected:
    void SetUp() override
    {
        if (hDevice1 != 0)
            obxsimClose(hDevice1);
        hDevice1 = AsyncEventHandle = IpmiVersion = 0;
        obxsimReset();
        obxSetOs(&simOs);
    }
    void TearDown() override { SetUp(), obxSetOs(nullptr); }
    // The controller's log without the device's opening and identification
    // and without the expiries, which come on the controller's own time.
    static std::string actions()
    {
        std::string out;
        for (const std::string& line : obxsimLog())
            if (line != "get device id" && line.rfind("open /dev/obx", 0) && line.rfind("watchdog expired", 0))
                out += line + "; ";
        return out;
    }
    static bool logged(const std::string& line) { return actions().find(line + "; ") != std::string::npos; }
    static std::vector<ObxSimRequest> requestsFor(uint8_t netFunction, uint8_t command)
    {
        std::vector<ObxSimRequest> found;
        for (const ObxSimRequest& request : obxsimRequests())
            if (request.netFunction == netFunction && request.command == command)
                found.push_back(request);
        return found;
    }
};
