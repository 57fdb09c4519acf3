#include "BTHLocks.h"

#include <array>
#include <random>

#include "TestSupport.h"

namespace berth {
namespace {

using namespace std::chrono_literals;
using test::eventually;

std::optional<BTHLocksSnapshot::Record> recordOf(const std::string& identifier) {
    for (const auto& record : BTHLocksSnapshotForTesting().records)
        if (record.identifier == identifier) return record;
    return std::nullopt;
}

// True once `identifier` has `useCount` acquisitions entered (holding or
// waiting for its own lock).
bool entered(const std::string& identifier, uint64_t useCount) {
    return eventually([&] {
        auto record = recordOf(identifier);
        return record && record->useCount == useCount;
    });
}

void expectNothingHeld() {
    BTHLocksSnapshot snapshot = BTHLocksSnapshotForTesting();
    EXPECT_EQ(snapshot.identifierReaderCount, 0);
    EXPECT_EQ(snapshot.identifierWriterCount, 0);
    EXPECT_EQ(snapshot.allReaderWriterState, 0);
    EXPECT_TRUE(snapshot.records.empty()) << snapshot.records.front().identifier;
}

// One lock request made on its own thread, so the test can watch it wait.
// The test thread releases what it took: the locks are not tied to threads.
class Request {
  public:
    Request(std::function<void()> acquire, std::function<void()> release)
        : state_(std::make_shared<State>()), release_(std::move(release)) {
        thread_ = std::thread([state = state_, acquire = std::move(acquire)] {
            acquire();
            state->acquired = true;
        });
    }
    static Request identifier(std::string identifier, bool forWriting) {
        return Request([=] { _lock_identifier(identifier, forWriting); },
                       [=] { unlock_identifier(identifier); });
    }
    static Request all(bool forWriting) {
        return Request([=] { _lock_all_identifiers(forWriting); },
                       [] { unlock_all_identifiers(); });
    }
    Request(Request&&) = default;

    ~Request() {
        if (!thread_.joinable()) return;
        // A request that never got its lock is a failed test; leave it blocked.
        if (state_->acquired)
            thread_.join();
        else
            thread_.detach();
    }

    bool acquired() const { return state_->acquired; }
    bool becomesAcquired() const {
        return eventually([this] { return acquired(); });
    }
    // Gives a request that the rules should hold off time to get through.
    bool keepsWaiting() const {
        std::this_thread::sleep_for(50ms);
        return !acquired();
    }
    void release() {
        release_();
        released_ = true;
    }
    bool released() const { return released_; }

  private:
    struct State {
        std::atomic<bool> acquired{false};
    };
    std::shared_ptr<State> state_;
    std::function<void()> release_;
    bool released_ = false;
    std::thread thread_;
};

TEST(BTHLocksTest, ArraysTakeEachIdentifierOnceAscendingAndReleaseDescending) {
    struct Case {
        std::vector<std::string> identifiers;
        std::vector<std::string> takeOrder;
    };
    // Byte order: upper case before lower case, multi-byte characters last.
    const std::vector<Case> cases = {
        {{}, {}},
        {{"b", "a"}, {"a", "b"}},
        {{"a", "b"}, {"a", "b"}},
        {{"b", "z", "a", "B", "\xC3\xA9", "a", "b", "a"}, {"B", "a", "b", "z", "\xC3\xA9"}},
    };
    for (bool asValue : {false, true}) {
        for (const Case& c : cases) {
            SCOPED_TRACE(testing::PrintToString(c.identifiers) + (asValue ? " as value" : ""));
            const Value value(Value::Array(c.identifiers.begin(), c.identifiers.end()));
            std::vector<std::string> seen;
            {
                test::LogCapture log;
                asValue ? _lock_identifier(value, false) : _lock_identifier(c.identifiers, false);
                BTHLocksSnapshot held = BTHLocksSnapshotForTesting();
                EXPECT_EQ(held.identifierReaderCount, static_cast<int32_t>(c.takeOrder.size()));
                ASSERT_EQ(held.records.size(), c.takeOrder.size());
                for (const auto& record : held.records) {
                    EXPECT_EQ(record.useCount, 1u) << record.identifier;
                    EXPECT_EQ(record.lockState, 1) << record.identifier;
                }
                asValue ? unlock_identifier(value) : unlock_identifier(c.identifiers);
                for (const auto& line : log.lines())
                    if (line.message.starts_with("Got lock") ||
                        line.message.starts_with("Unlocked identifier"))
                        seen.push_back(line.message);
            }
            expectNothingHeld();
            std::vector<std::string> expected;
            for (const auto& id : c.takeOrder) expected.push_back("Got lock on identifier " + id);
            for (auto id = c.takeOrder.rbegin(); id != c.takeOrder.rend(); ++id)
                expected.push_back("Unlocked identifier " + *id);
            EXPECT_EQ(seen, expected);
        }
    }

    // A repeated identifier taken twice for writing would wait on itself.
    Request writer(
        [] {
            _lock_identifier(std::vector<std::string>{"x", "x", "x"}, true);
        },
        [] {
            unlock_identifier(std::vector<std::string>{"x", "x"});
        });
    ASSERT_TRUE(writer.becomesAcquired());
    EXPECT_EQ(recordOf("x")->useCount, 1u);
    EXPECT_EQ(recordOf("x")->lockState, -1);
    writer.release();
    expectNothingHeld();
}

TEST(BTHLocksTest, ReadersShareAnIdentifierAndAWriterWaitsForBoth) {
    _lock_identifier("x", false);
    _lock_identifier("x", false);
    EXPECT_EQ(recordOf("x")->lockState, 2);

    Request writer = Request::identifier("x", true);
    ASSERT_TRUE(entered("x", 3));
    EXPECT_EQ(BTHLocksSnapshotForTesting().identifierWriterCount, 1);
    EXPECT_TRUE(writer.keepsWaiting());
    unlock_identifier("x");
    EXPECT_EQ(recordOf("x")->lockState, 1);
    EXPECT_TRUE(writer.keepsWaiting());
    unlock_identifier("x");
    ASSERT_TRUE(writer.becomesAcquired());
    EXPECT_EQ(recordOf("x")->lockState, -1);
    EXPECT_EQ(recordOf("x")->useCount, 1u);

    // Released by another thread than the one that took it, the same record's
    // lock lets the next writer in.
    Request second = Request::identifier("x", true);
    ASSERT_TRUE(entered("x", 2));
    EXPECT_TRUE(second.keepsWaiting());
    writer.release();
    ASSERT_TRUE(second.becomesAcquired());
    second.release();
    expectNothingHeld();

    // The last release removed the record; a new acquisition starts afresh.
    _lock_identifier("x", true);
    EXPECT_EQ(recordOf("x")->useCount, 1u);
    EXPECT_EQ(recordOf("x")->lockState, -1);
    unlock_identifier("x");
    expectNothingHeld();
}

TEST(BTHLocksTest, ReadingAllSharesWithIdentifierReadersButWaitsForWriters) {
    _lock_identifier("x", false);
    _lock_all_identifiers(false);  // at once, on the same thread
    EXPECT_EQ(BTHLocksSnapshotForTesting().allReaderWriterState, 1);
    unlock_all_identifiers();

    // A writer that holds its identifier.
    Request holder = Request::identifier("y", true);
    ASSERT_TRUE(holder.becomesAcquired());
    Request allReader = Request::all(false);
    EXPECT_TRUE(allReader.keepsWaiting());
    holder.release();
    ASSERT_TRUE(allReader.becomesAcquired());
    allReader.release();

    // A writer still waiting for its identifier already counts.
    Request waiting = Request::identifier("x", true);
    ASSERT_TRUE(entered("x", 2));
    Request laterReader = Request::all(false);
    EXPECT_TRUE(laterReader.keepsWaiting());
    unlock_identifier("x");
    ASSERT_TRUE(waiting.becomesAcquired());
    EXPECT_TRUE(laterReader.keepsWaiting());
    waiting.release();
    ASSERT_TRUE(laterReader.becomesAcquired());
    laterReader.release();
    expectNothingHeld();
}

TEST(BTHLocksTest, WritingAllWaitsForEveryEnteredAcquisitionThenAdmitsOneWriter) {
    // The last acquisition to go is a reader, then a writer.
    for (bool lastWrites : {false, true}) {
        SCOPED_TRACE(lastWrites ? "last one writes" : "last one reads");
        _lock_identifier("x", true);
        Request last = Request::identifier("x", lastWrites);
        ASSERT_TRUE(entered("x", 2));

        Request first = Request::all(true);
        Request second = Request::all(true);
        EXPECT_TRUE(first.keepsWaiting());
        EXPECT_TRUE(second.keepsWaiting());
        unlock_identifier("x");
        ASSERT_TRUE(last.becomesAcquired());
        // It was still waiting for its identifier; now it holds it.
        EXPECT_TRUE(first.keepsWaiting());
        EXPECT_TRUE(second.keepsWaiting());

        last.release();
        ASSERT_TRUE(eventually([&] { return first.acquired() || second.acquired(); }));
        std::this_thread::sleep_for(50ms);
        ASSERT_NE(first.acquired(), second.acquired()) << "exactly one writer of all identifiers";
        EXPECT_EQ(BTHLocksSnapshotForTesting().allReaderWriterState, -1);
        Request& winner = first.acquired() ? first : second;
        Request& other = first.acquired() ? second : first;
        winner.release();
        ASSERT_TRUE(other.becomesAcquired());
        other.release();
        expectNothingHeld();
    }
}

TEST(BTHLocksTest, ReleasingAllForWritingLetsEveryWaitingKindCompete) {
    _lock_all_identifiers(true);
    std::vector<Request> requests;
    requests.push_back(Request::identifier("x", false));
    requests.push_back(Request::identifier("y", true));
    requests.push_back(Request::all(false));
    requests.push_back(Request::all(true));
    std::this_thread::sleep_for(50ms);
    for (const Request& request : requests) EXPECT_FALSE(request.acquired());

    unlock_all_identifiers();
    // Whoever wins, releasing each winner must in the end let everyone in.
    bool everyoneIn = eventually([&] {
        bool all = true;
        for (Request& request : requests) {
            if (request.acquired() && !request.released()) request.release();
            all = all && request.released();
        }
        return all;
    });
    ASSERT_TRUE(everyoneIn);
    expectNothingHeld();
}

TEST(BTHLocksTest, ReadingAllLetsIdentifierReadersInAndHoldsWritersUntilTheLastRelease) {
    _lock_all_identifiers(false);
    _lock_all_identifiers(false);
    Request reader = Request::identifier("x", false);
    ASSERT_TRUE(reader.becomesAcquired());
    Request y = Request::identifier("y", true);
    Request z = Request::identifier("z", true);
    EXPECT_TRUE(y.keepsWaiting());
    EXPECT_TRUE(z.keepsWaiting());
    EXPECT_EQ(BTHLocksSnapshotForTesting().identifierWriterCount, 0) << "not counted yet";

    unlock_all_identifiers();
    EXPECT_TRUE(y.keepsWaiting());
    EXPECT_TRUE(z.keepsWaiting());
    unlock_all_identifiers();
    ASSERT_TRUE(y.becomesAcquired());
    ASSERT_TRUE(z.becomesAcquired());
    EXPECT_EQ(BTHLocksSnapshotForTesting().identifierWriterCount, 2);
    for (Request* request : {&reader, &y, &z}) request->release();
    expectNothingHeld();
}

TEST(BTHLocksTest, GuardsHoldOnlyWhenEngagedAndOnlyForTheirScope) {
    for (bool engaged : {true, false}) {
        {
            BTHIdentifierLockGuard guard("x", true, engaged);
            EXPECT_EQ(recordOf("x").has_value(), engaged);
        }
        {
            BTHAllIdentifiersLockGuard guard(true, engaged);
            EXPECT_EQ(BTHLocksSnapshotForTesting().allReaderWriterState, engaged ? -1 : 0);
        }
        expectNothingHeld();
    }
}

TEST(BTHLocksTest, DebugLinesCarryTheirFunctionAndAreWrittenOnlyWhenEnabled) {
    using Line = std::pair<std::string, std::string>;
    auto run = [](int threshold) {
        test::LogCapture log(threshold);
        _lock_identifier("x", true);
        unlock_identifier("x");
        _lock_all_identifiers(false);
        unlock_all_identifiers();
        std::vector<Line> lines;
        for (const auto& line : log.lines()) {
            EXPECT_EQ(line.level, 7);
            lines.emplace_back(line.function, line.message);
        }
        return lines;
    };
    const std::vector<Line> expected = {
        {"take_one_lock", "Waiting to lock x for writing"},
        {"take_one_lock", "Got lock on identifier x"},
        {"unlock_one_lock", "Unlocked identifier x"},
        {"unlock_one_lock", "Destroying lock for identifier x"},
        {"_lock_all_identifiers", "Waiting to lock all identifiers for reading"},
        {"_lock_all_identifiers", "Locked all identifiers for reading"},
        {"unlock_all_identifiers", "Unlocked all identifiers"},
    };
    EXPECT_EQ(run(7), expected);
    EXPECT_TRUE(run(5).empty());
}

TEST(BTHLocksDeathTest, MisuseEndsTheProcessNamingTheBrokenCondition) {
    GTEST_FLAG_SET(death_test_style, "threadsafe");
    EXPECT_DEATH(unlock_identifier("never-held"),
                 "BTHLocks invariant violated: identifierToLockMap");
    EXPECT_DEATH(
        {
            _lock_identifier("once", false);
            unlock_identifier("once");
            unlock_identifier("once");
        },
        "BTHLocks invariant violated: identifierToLockMap holds a record");
    EXPECT_DEATH(unlock_all_identifiers(), "BTHLocks invariant violated: allReaderWriterState > 0");
    EXPECT_DEATH(_lock_identifier(Value(5), false), "Unknown parameter type!");
    EXPECT_DEATH(_lock_identifier(Value(Value::Array{"a", 5}), true), "Unknown parameter type!");
    EXPECT_DEATH(unlock_identifier(Value::dictionary()), "unlock_identifier: Unknown parameter");
}

// Many threads mixing every kind of request over a few identifiers. Each
// holder counts itself in while it holds and checks that nobody it excludes
// is counted; at the end nothing may be left behind.
class Occupancy {
  public:
    static constexpr size_t kIdentifiers = 4;

    void enterIdentifier(size_t id, bool writing) {
        (writing ? writers_ : readers_)[id]++;
        checkIdentifier(id, writing);
    }
    void leaveIdentifier(size_t id, bool writing) {
        checkIdentifier(id, writing);
        (writing ? writers_ : readers_)[id]--;
    }
    void enterAll(bool writing) {
        (writing ? allWriters_ : allReaders_)++;
        checkAll(writing);
    }
    void leaveAll(bool writing) {
        checkAll(writing);
        (writing ? allWriters_ : allReaders_)--;
    }
    int violations() const { return violations_; }

  private:
    void expect(bool condition) {
        if (!condition) ++violations_;
    }
    int sum(const std::array<std::atomic<int>, kIdentifiers>& counts) const {
        int total = 0;
        for (const auto& count : counts) total += count;
        return total;
    }
    void checkIdentifier(size_t id, bool writing) {
        expect(allWriters_ == 0 &&
               (writing ? writers_[id] == 1 && readers_[id] == 0 && allReaders_ == 0
                        : writers_[id] == 0));
    }
    void checkAll(bool writing) {
        expect(sum(writers_) == 0 &&
               (writing ? allWriters_ == 1 && allReaders_ == 0 && sum(readers_) == 0
                        : allWriters_ == 0));
    }

    std::array<std::atomic<int>, kIdentifiers> readers_{};
    std::array<std::atomic<int>, kIdentifiers> writers_{};
    std::atomic<int> allReaders_{0};
    std::atomic<int> allWriters_{0};
    std::atomic<int> violations_{0};
};

void holdBriefly() {
    for (int i = 0; i < 3; ++i) std::this_thread::yield();
}

void runRandomRequest(std::mt19937& random, Occupancy& occupancy) {
    static const std::array<std::string, Occupancy::kIdentifiers> names = {"A", "B", "C", "D"};
    std::uniform_int_distribution<size_t> pickId(0, Occupancy::kIdentifiers - 1);
    bool writing = random() % 2 == 0;
    switch (random() % 4) {
        case 0: {  // one identifier
            size_t id = pickId(random);
            _lock_identifier(names[id], writing);
            occupancy.enterIdentifier(id, writing);
            holdBriefly();
            occupancy.leaveIdentifier(id, writing);
            unlock_identifier(names[id]);
            break;
        }
        case 1: {  // several, possibly repeated, as the caller lists them
            std::vector<std::string> list;
            std::set<size_t> ids;
            for (size_t n = 1 + random() % 3; n > 0; --n) {
                size_t id = pickId(random);
                list.push_back(names[id]);
                ids.insert(id);
            }
            _lock_identifier(list, writing);
            for (size_t id : ids) occupancy.enterIdentifier(id, writing);
            holdBriefly();
            for (size_t id : ids) occupancy.leaveIdentifier(id, writing);
            unlock_identifier(list);
            break;
        }
        case 2: {  // all identifiers
            _lock_all_identifiers(writing);
            occupancy.enterAll(writing);
            holdBriefly();
            occupancy.leaveAll(writing);
            unlock_all_identifiers();
            break;
        }
        default: {  // one identifier read under all identifiers read
            size_t id = pickId(random);
            _lock_all_identifiers(false);
            occupancy.enterAll(false);
            _lock_identifier(names[id], false);
            occupancy.enterIdentifier(id, false);
            holdBriefly();
            occupancy.leaveIdentifier(id, false);
            unlock_identifier(names[id]);
            occupancy.leaveAll(false);
            unlock_all_identifiers();
            break;
        }
    }
}

TEST(BTHLocksTest, ManyThreadsMixingEveryRequestKeepExclusionAndLeaveNothingBehind) {
    constexpr int kThreads = 12;
    constexpr int kIterations = 1500;
    Occupancy occupancy;
    std::vector<std::thread> threads;
    for (int t = 0; t < kThreads; ++t) {
        threads.emplace_back([t, &occupancy] {
            std::mt19937 random(1000 + t);
            for (int i = 0; i < kIterations; ++i) runRandomRequest(random, occupancy);
        });
    }
    for (auto& thread : threads) thread.join();
    EXPECT_EQ(occupancy.violations(), 0);
    expectNothingHeld();
}

}  // namespace
}  // namespace berth
