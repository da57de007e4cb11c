// The retry loop of runInTransaction, the plain Transaction, and real
// concurrent writers.

#include <gtest/gtest.h>

#include <atomic>
#include <thread>
#include <vector>

#include "engine_fixture.h"
#include "support/log_capture.h"

namespace {

using namespace engine_testing;
using testing_support::LogCapture;
using testing_support::VerboseLog;

class Transactions : public EngineTest {
 protected:
  Transactions() {
    env_.setSleepHook([this](std::chrono::milliseconds d) {
      pauses_.push_back(d);
      if (onPause_) onPause_();
    });
  }
  std::shared_ptr<engine::Instance> instance_ = makeInstance("txn");
  std::unique_ptr<engine::Session> session_ = makeDatabase(instance_);
  std::vector<std::chrono::milliseconds> pauses_;
  std::function<void()> onPause_;
};

TEST_F(Transactions, ConflictOnceCommitsOnTheSecondAttempt) {
  VerboseLog verbose;
  LogCapture log;
  int runs = 0;
  const int result = DB::runInTransaction(*session_, [&] {
    ++runs;
    session_->prepare("UPDATE counter SET value = value + 1").run();
    if (runs == 1) DB::throwEngineError(err::kWriteConflict);
    return runs * 10;
  });
  EXPECT_EQ(result, 20);
  EXPECT_EQ(runs, 2);
  EXPECT_EQ(counter(*session_), 1);  // the first attempt's write was rolled back
  ASSERT_EQ(pauses_.size(), 1u);
  EXPECT_LE(pauses_[0], std::chrono::milliseconds(1000));
  EXPECT_EQ(log.count(Log::Debug, "Transaction::retry S:" + std::to_string(session_->id()) + " 1 attempt(s) so far."),
            1u);
  EXPECT_FALSE(session_->inTransaction());
}

// Gives up after 120 retries, or earlier once the pauses add up to 30 s, so
// that a command is never held for minutes; a code that does not normally
// go away is retried with a warning each time.
TEST_F(Transactions, AlwaysRetryableGivesUpAfter120RetriesOrThirtySecondsOfPauses) {
  LogCapture log;
  int runs = 0;
  try {
    DB::runInTransaction(*session_, [&] {
      ++runs;
      session_->prepare("UPDATE counter SET value = value + 1").run();
      DB::throwEngineError(err::kRecordNotFound);
    });
    FAIL() << "no exception";
  } catch (const DB::DBExc& e) {
    EXPECT_STREQ(e.what(), "Transaction made too many attmepts to gain access to a locked item");
    EXPECT_EQ(e.code(), DB::DBExc::kTextCode);
  }
  std::chrono::milliseconds paused{0};
  for (const auto p : pauses_) paused += p;
  ASSERT_LE(pauses_.size(), 120u);
  EXPECT_EQ(runs, static_cast<int>(pauses_.size()) + 1);
  EXPECT_TRUE(pauses_.size() == 120 || paused >= DB::Transaction::kMaxPauseTotal) << paused.count();
  EXPECT_LT(paused, DB::Transaction::kMaxPauseTotal + std::chrono::milliseconds(DB::Transaction::kMaxPauseMs));
  EXPECT_EQ(log.count(Log::Warning, "retries engine error -1601, which does not normally go away on retry"),
            static_cast<std::size_t>(runs));
  EXPECT_FALSE(session_->inTransaction());
  EXPECT_EQ(counter(*session_), 0);
  // The session is free for the next command.
  DB::runInTransaction(*session_, [&] { session_->prepare("UPDATE counter SET value = 3").run(); });
  EXPECT_EQ(counter(*session_), 3);
}

TEST_F(Transactions, OtherFailuresPassAtOnceAfterRollbackAndAPlainTransactionNeedsItsCommit) {
  {
    DB::Transaction txn(*session_);
    session_->prepare("UPDATE counter SET value = 5").run();
  }
  EXPECT_EQ(counter(*session_), 0);
  int runs = 0;
  const auto attempt = [&](const std::function<void()>& fail) {
    DB::runInTransaction(*session_, [&] {
      ++runs;
      session_->prepare("UPDATE counter SET value = value + 1").run();
      fail();
    });
  };
  EXPECT_EQ(codeOf([&] { attempt([] { DB::throwEngineError(err::kInvalidParameter); }); }), err::kInvalidParameter);
  EXPECT_THROW(attempt([] { throw std::runtime_error("not the engine's"); }), std::runtime_error);
  EXPECT_EQ(runs, 2);
  EXPECT_TRUE(pauses_.empty());
  EXPECT_FALSE(session_->inTransaction());
  EXPECT_EQ(counter(*session_), 0);
}

// The pause holds no lock: another writer of the database gets through
// while the failed attempt waits.
TEST_F(Transactions, PauseHoldsNoLock) {
  auto other = openSession(instance_);
  bool otherWrote = false;
  onPause_ = [&] {
    DB::Transaction txn(*other);
    other->prepare("UPDATE counter SET value = 100").run();
    txn.commit();
    otherWrote = true;
  };
  int runs = 0;
  DB::runInTransaction(*session_, [&] {
    if (++runs == 1) DB::throwEngineError(err::kWriteConflict);
    session_->prepare("UPDATE counter SET value = value + 1").run();
  });
  EXPECT_TRUE(otherWrote);
  EXPECT_EQ(counter(*session_), 101);
}

// On this engine the write lock is taken at the begin, so a wait for it
// that times out is a conflict like any other: retried after a pause.
TEST_F(Transactions, ConflictAtTheBeginIsRetried) {
  engine::InstanceSettings settings = instance_->settings();
  settings.key = "short";
  settings.busyTimeout = std::chrono::milliseconds(100);
  auto quick = makeInstance(settings);
  // Two instances on one file only meet in SQLite's lock, which is what a
  // begin waits for here.
  auto waiter = quick->beginSession();
  waiter->attachDatabase(*instance_->attachedDatabase());
  auto holder = std::make_unique<DB::Transaction>(*session_);
  onPause_ = [&] { holder.reset(); };

  int runs = 0;
  DB::runInTransaction(*waiter, [&] {
    ++runs;
    waiter->prepare("UPDATE counter SET value = 9").run();
  });
  EXPECT_EQ(runs, 1);
  EXPECT_EQ(pauses_.size(), 1u);
  EXPECT_EQ(counter(*session_), 9);
}

// Read-modify-write from many threads, on two instances of one file so
// that the writers also meet in SQLite's own lock: no increment is lost.
TEST_F(Transactions, ConcurrentIncrementsEndWithTheExactSum) {
  engine::InstanceSettings settings = instance_->settings();
  settings.key = "second";
  auto second = makeInstance(settings);
  {
    auto attach = second->beginSession();
    attach->attachDatabase(*instance_->attachedDatabase());
  }
  constexpr int kThreads = 8;
  constexpr int kIncrements = 150;
  std::vector<std::thread> threads;
  std::atomic<int> failures{0};
  for (int t = 0; t < kThreads; ++t) {
    threads.emplace_back([&, t] {
      try {
        auto session = openSession(t % 2 == 0 ? instance_ : second);
        for (int i = 0; i < kIncrements; ++i) {
          DB::runInTransaction(*session, [&] {
            auto read = session->prepare("SELECT value FROM counter WHERE id = 1");
            read.step();
            const auto value = read.columnInt64(0);
            read.reset();
            session->prepare("UPDATE counter SET value = ? WHERE id = 1").bindInt64(1, value + 1).run();
          });
        }
      } catch (const std::exception& e) {
        ADD_FAILURE() << e.what();
        ++failures;
      }
    });
  }
  for (auto& t : threads) t.join();
  EXPECT_EQ(failures, 0);
  EXPECT_EQ(counter(*session_), kThreads * kIncrements);
}

}  // namespace
