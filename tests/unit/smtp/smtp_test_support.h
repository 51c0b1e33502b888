// Shared pieces of the SMTP client's tests: an alert in heap slots of the
// exact sizes, the captured log, and one run of the dialogue.
#pragma once

#include <gtest/gtest.h>

#include <chrono>
#include <cstdlib>
#include <cstring>
#include <mutex>
#include <string>
#include <vector>

#include "base/log.h"
#include "base/sleep.h"
#include "smtp/smtp.h"

// The five texts in blocks of exactly their slot sizes, so that a read past a
// slot is an AddressSanitizer error.
struct Alert {
    static constexpr size_t sizes[5] = {EMAIL_SERVER_SIZE, EMAIL_SENDER_SIZE, EMAIL_RECIPIENTS_SIZE,
                                        EMAIL_SUBJECT_SIZE, EMAIL_BODY_SIZE};
    char* slot[5] = {};

    Alert(const std::string& server, const std::string& sender, const std::string& recipients,
          const std::string& subject, const std::string& body)
    {
        const std::string* texts[5] = {&server, &sender, &recipients, &subject, &body};
        for (int i = 0; i < 5; i++) {
            slot[i] = static_cast<char*>(calloc(sizes[i], 1));
            memcpy(slot[i], texts[i]->data(), std::min(texts[i]->size(), sizes[i] - 1));
        }
    }
    Alert(const Alert&) = delete;
    Alert& operator=(const Alert&) = delete;
    ~Alert()
    {
        for (char* s : slot)
            free(s);
    }

    // Fills a slot completely, leaving it without a terminator.
    void fillWithoutTerminator(int i, const std::string& pattern)
    {
        for (size_t k = 0; k < sizes[i]; k++)
            slot[i][k] = pattern[k % pattern.size()];
    }

    EmailConfig config() const { return {slot[0], slot[1], slot[2], slot[3], slot[4]}; }
};

struct LogCapture {
    static std::mutex& mutex()
    {
        static std::mutex m;
        return m;
    }
    static std::vector<std::pair<int, std::string>>& lines()
    {
        static std::vector<std::pair<int, std::string>> l;
        return l;
    }
    static void hook(int priority, const char* text)
    {
        std::lock_guard<std::mutex> lock(mutex());
        lines().emplace_back(priority, text);
    }
    static std::vector<std::pair<int, std::string>> take()
    {
        std::lock_guard<std::mutex> lock(mutex());
        auto result = lines();
        lines().clear();
        return result;
    }
};

struct SleepCapture {
    static std::vector<unsigned>& requests()
    {
        static std::vector<unsigned> r;
        return r;
    }
    static void hook(unsigned ms) { requests().push_back(ms); }
};

struct Outcome {
    int result;
    std::string standardError;
    long long ms;
};

inline Outcome runDialogue(const Alert& alert, uint16_t port)
{
    smtpSetPort(port);
    EmailConfig config = alert.config();
    testing::internal::CaptureStderr();
    auto start = std::chrono::steady_clock::now();
    int result = _MoxSendEmail(&config);
    auto elapsed = std::chrono::steady_clock::now() - start;
    std::string err = testing::internal::GetCapturedStderr();
    return {result, err, std::chrono::duration_cast<std::chrono::milliseconds>(elapsed).count()};
}

// The system-log line of a failed step, as the log receives it.
inline std::string failureLine(int errorClass, int step, int value, const std::string& message)
{
    std::string reason2 = errorClass == 3 ? "An invalid response was receieved or a command timed out" : message;
    reason2 = reason2.substr(0, 127);
    std::string reasons = "Mox email alert was not sent " + reason2 + " The last command returned the following values:" +
                          std::to_string(step) + ", " + std::to_string(value);
    switch (errorClass) {
    case 1:
        return "mox - Email Alert failed - sockets library error! Error Value=" + std::to_string(value) +
               ",Reason:" + reasons + "\n\n";
    case 2:
        return "mox - Email Alert failed - smtp command failed in step[" + std::to_string(step) + "]!,ErrorCode:[" +
               std::to_string(value) + "], Reason: " + reasons + "\n\n";
    default:
        return "mox - Email Alert failed - command timeout!, Reason:" + reasons + "\n\n";
    }
}

class SmtpTest : public testing::Test {
protected:
    static constexpr unsigned LIMIT_MS = 500;

    void SetUp() override
    {
        LogCapture::take();
        SleepCapture::requests().clear();
        moxSetLogHook(LogCapture::hook);
        moxSetSleepHook(SleepCapture::hook);
        smtpSetLimitMs(LIMIT_MS);
    }
    void TearDown() override
    {
        moxSetLogHook(nullptr);
        moxSetSleepHook(nullptr);
        smtpSetWritableHook(nullptr);
        smtpSetLimitMs(8000);
        smtpSetPort(25);
    }
};
