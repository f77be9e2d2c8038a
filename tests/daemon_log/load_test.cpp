#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <cstdio>
#include <filesystem>
#include <map>
#include <sstream>
#include <thread>

#include "daemon_log/other_unit.h"
#include "ha_log.h"
#include "support/files.h"
#include "support/programs.h"
#include "support/sandbox.h"
#include "support/wait.h"

namespace {

using namespace std::chrono_literals;
using TERN::HA::Daemon::daemonLog;
using TERN::HA::Daemon::DaemonLog;

constexpr char DIRECTORY[] = "/var/log/ha";
constexpr auto DURATION = 20s;
constexpr int BURST = 20;

// Append numbered lines in bursts for DURATION; return their number.
int append(DaemonLog& log, const std::string& writer) {
    int number = 0;
    const test::Stopwatch stopwatch;
    while (stopwatch.elapsed() < DURATION) {
        for (int i = 0; i < BURST; ++i) {
            log.set(writer + " " + std::to_string(number) + " " +
                    std::string(static_cast<std::size_t>(number % 200), 'x') + " end");
            ++number;
        }
        std::this_thread::sleep_for(10ms);
    }
    return number;
}

// Append from two threads for each of two log objects; write the number of lines of each to a file.
int appendFromTwoUnits(const std::string& process) {
    std::vector<std::thread> threads;
    for (int i = 0; i < 4; ++i) {
        threads.emplace_back([&process, i] {
            const std::string writer = process + std::to_string(i);
            const int count = append(i % 2 == 0 ? *daemonLog : *test::otherDaemonLog(), writer);
            test::writeFile("/tmp/count." + writer, std::to_string(count));
        });
    }
    for (std::thread& thread : threads) {
        thread.join();
    }
    return 0;
}

// Return the lines of the log on disk, its archives and the buffer.
std::vector<std::string> allLines() {
    std::vector<std::string> all;
    std::vector<std::string> files = {"/tmp/ha/ha.daemon.log"};
    for (const auto& entry : std::filesystem::directory_iterator(DIRECTORY)) {
        files.push_back(entry.path().string());
    }
    for (const std::string& file : files) {
        const bool isCompressed = file.size() > 3 && file.substr(file.size() - 3) == ".xz";
        const std::string text = isCompressed
                                     ? test::run({"/bin/xz", "--decompress", "--stdout", file}).output
                                     : test::readFile(file);
        for (const std::string& message : test::messages(text)) {
            all.push_back(message);
        }
    }
    return all;
}

TEST(LogUnderLoadTest, ConcurrentRotationNeitherTearsNorDuplicatesLines) {
    test::makeDirectories("/tmp/ha");
    test::makeDirectories(DIRECTORY);
    const pid_t other = fork();
    if (other == 0) {
        _exit(appendFromTwoUnits("b"));
    }
    ASSERT_GT(other, 0);
    std::atomic<bool> isOver{false};
    std::thread mover([&isOver] {
        for (int moves = 1; !isOver; ++moves) {
            daemonLog->writeLogToDisk();
            if (moves % 100 == 0) {
                daemonLog->rotate();
            }
            std::this_thread::sleep_for(20ms);
        }
    });
    appendFromTwoUnits("a");
    int status = -1;
    EXPECT_EQ(waitpid(other, &status, 0), other);
    EXPECT_EQ(status, 0);
    isOver = true;
    mover.join();

    std::map<std::string, std::map<int, int>> seen;  // how often each line of each writer came
    for (const std::string& line : allLines()) {
        std::istringstream words(line);
        std::string writer;
        std::string rest;
        int number = -1;
        words >> writer >> number;
        std::getline(words, rest);
        ASSERT_EQ(rest, " " + std::string(static_cast<std::size_t>(number % 200), 'x') + " end") << line;
        ++seen[writer][number];
    }
    ASSERT_EQ(seen.size(), 8U);
    int appended = 0;
    int arrived = 0;
    for (const auto& [writer, numbers] : seen) {
        const int count = std::stoi(test::readFile("/tmp/count." + writer));
        appended += count;
        arrived += static_cast<int>(numbers.size());
        for (const auto& [number, times] : numbers) {
            EXPECT_LT(number, count);
            EXPECT_EQ(times, 1) << writer << " " << number;
        }
    }
    // A move drops lines that arrive between its last read and the truncation, which takes
    // microseconds.
    std::printf("%d of %d lines lost\n", appended - arrived, appended);
    EXPECT_LT(appended - arrived, appended / 100);
}

}  // namespace
