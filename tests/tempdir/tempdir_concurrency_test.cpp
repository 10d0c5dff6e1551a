// Temporary-directory resolution from many threads at once: the unlocked flag check, the double
// resolution it allows, publication under the cache lock, and environment reads under the
// environment lock. Meant to run under ThreadSanitizer as well as plainly.
#include <gtest/gtest.h>

#include <stdlib.h>

#include <atomic>
#include <mutex>
#include <set>
#include <shared_mutex>
#include <string>
#include <thread>
#include <vector>

#include "tempdir/TempDirectory.h"
#include "tempdir/TempDirectoryCache.h"

namespace {

constexpr int kThreads = 16;

// Sets an environment variable while holding the module's environment lock exclusively.
bool setVariable(const std::string& name, const std::string& value) {
    std::unique_lock<std::shared_mutex> lock(kov::environmentMutex());
#ifdef _WIN32
    return ::_putenv_s(name.c_str(), value.c_str()) == 0;
#else
    return ::setenv(name.c_str(), value.c_str(), 1) == 0;
#endif
}

// Starts `count` threads running `body(index)` and releases them together, so that they really
// overlap; joins them all.
template <typename Body>
void runTogether(int count, Body body) {
    std::atomic<int> ready{0};
    std::atomic<bool> go{false};
    std::vector<std::thread> threads;
    threads.reserve(static_cast<std::size_t>(count));
    for (int i = 0; i < count; ++i) {
        threads.emplace_back([&, i]() {
            ready.fetch_add(1);
            while (!go.load()) {
                std::this_thread::yield();
            }
            body(i);
        });
    }
    while (ready.load() < count) {
        std::this_thread::yield();
    }
    go.store(true);
    for (std::thread& thread : threads) {
        thread.join();
    }
}

class TempDirConcurrencyTest : public ::testing::Test {
  protected:
    void SetUp() override { kov::tempDirectoryCache().TEST_reset(); }
    void TearDown() override { kov::tempDirectoryCache().TEST_reset(); }
};

TEST_F(TempDirConcurrencyTest, SixteenThreadsOnAFreshCacheGetTheSameText) {
    ASSERT_FALSE(kov::tempDirectoryCache().initialised());
    std::vector<std::string> answers(kThreads);
    runTogether(kThreads, [&answers](int i) {
        answers[static_cast<std::size_t>(i)] = kov::getTempDirectory();
    });
    EXPECT_TRUE(kov::tempDirectoryCache().initialised());
    const std::string published = kov::tempDirectoryCache().path();
    EXPECT_FALSE(published.empty());
    for (const std::string& answer : answers) {
        EXPECT_EQ(answer, published);
    }
    EXPECT_EQ(kov::getTempDirectory(), published);
}

TEST_F(TempDirConcurrencyTest, RepeatedFreshStartsAllAgree) {
    for (int round = 0; round < 20; ++round) {
        kov::tempDirectoryCache().TEST_reset();
        std::vector<std::string> answers(kThreads);
        runTogether(kThreads, [&answers](int i) {
            answers[static_cast<std::size_t>(i)] = kov::getTempDirectory();
        });
        const std::set<std::string> distinct(answers.begin(), answers.end());
        ASSERT_EQ(distinct.size(), 1u) << "round " << round;
        EXPECT_EQ(*distinct.begin(), kov::tempDirectoryCache().path());
    }
}

TEST_F(TempDirConcurrencyTest, ReadersNeverSeeAHalfPublishedRecord) {
    // Writers publish pairs that belong together; a reader that sees the flag must find one whole
    // pair, never an empty path or a path with another pair's source.
    constexpr int kWriters = 4;
    constexpr int kRounds = 300;
    std::atomic<int> torn{0};
    std::atomic<int> empty{0};
    runTogether(kThreads, [&](int i) {
        kov::TempDirectoryCache& cache = kov::tempDirectoryCache();
        for (int round = 0; round < kRounds; ++round) {
            if (i < kWriters) {
                const std::string tag = std::to_string(i) + "-" + std::to_string(round);
                cache.publish("/dir/" + tag, "source-" + tag);
            } else if (cache.initialised()) {
                const std::string path = cache.path();
                if (path.empty()) {
                    empty.fetch_add(1);
                }
                if (path.rfind("/dir/", 0) != 0) {
                    torn.fetch_add(1);
                }
            }
        }
    });
    EXPECT_EQ(empty.load(), 0);
    EXPECT_EQ(torn.load(), 0);
    const std::string path = kov::tempDirectoryCache().path();
    const std::string source = kov::tempDirectoryCache().source();
    ASSERT_EQ(path.rfind("/dir/", 0), 0u);
    EXPECT_EQ(source, "source-" + path.substr(5));  // the last publish wrote both fields
}

TEST_F(TempDirConcurrencyTest, CallersDuringExplicitPublishesSeeAPublishedText) {
    // Half the threads resolve with an explicit directory, half ask for the directory; every
    // answer is one of the texts that were published, and the final answer is a whole one.
    std::vector<std::string> answers(kThreads);
    runTogether(kThreads, [&answers](int i) {
        if (i % 2 == 0) {
            const std::string mine = "explicit-" + std::to_string(i) + "/";
            kov::resolveTempDirectory(mine.c_str());
        } else {
            answers[static_cast<std::size_t>(i)] = kov::getTempDirectory();
        }
    });
    const std::string searched = [] {
        kov::tempDirectoryCache().TEST_reset();
        return kov::getTempDirectory();
    }();
    for (int i = 1; i < kThreads; i += 2) {
        const std::string& answer = answers[static_cast<std::size_t>(i)];
        const bool explicitOne = answer.rfind("explicit-", 0) == 0 && answer.back() != '/';
        EXPECT_TRUE(explicitOne || answer == searched) << answer;
    }
}

TEST_F(TempDirConcurrencyTest, EnvironmentLookupsAreNotTornByAWriterHoldingTheLock) {
    // One thread changes a variable while holding the environment lock exclusively, as code that
    // changes the environment should; the others look it up and always find one whole value.
    const std::string name = "KOV_CONCURRENCY_TEST_VALUE";
    const std::string values[2] = {"alpha-value", std::string(300, 'b')};
    ASSERT_TRUE(setVariable(name, values[0]));
    std::atomic<int> unexpected{0};
    std::atomic<int> failedWrites{0};
    runTogether(kThreads, [&](int i) {
        for (int round = 0; round < 200; ++round) {
            if (i == 0) {
                if (!setVariable(name, values[round % 2])) {
                    failedWrites.fetch_add(1);
                }
            } else {
                const std::string seen = kov::getEnvironmentVariable(name);
                if (seen != values[0] && seen != values[1]) {
                    unexpected.fetch_add(1);
                }
            }
        }
    });
    EXPECT_EQ(failedWrites.load(), 0);
    EXPECT_EQ(unexpected.load(), 0);
    EXPECT_EQ(kov::getEnvironmentVariable(name), values[1]);  // the last round wrote values[1]
}

}  // namespace
