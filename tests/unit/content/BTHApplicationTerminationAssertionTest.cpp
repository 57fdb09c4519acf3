// The termination assertion against a scripted termination service: how
// reasons reach the service, that creation waits for the acquisition however
// late it is reported, what a failed acquisition leaves behind, and that the
// service's assertion is released exactly once.
#include <gtest/gtest.h>

#include <thread>

#include "BTHApplicationTerminationAssertion.h"
#include "TestSupport.h"

namespace berth {
namespace {

using namespace std::chrono_literals;

// Answers each acquisition as told, on a thread of its own after a delay,
// and counts what it was asked.
class FakeTerminationService : public ApplicationTerminationService {
  public:
    std::optional<TerminationError> failWith;
    bool giveNoAssertion = false;
    std::chrono::milliseconds answerAfter = 0ms;

    std::vector<std::pair<std::string, TerminationReason>> created;
    std::map<TerminationAssertionHandle*, int> invalidations;
    std::atomic<bool> answered{false};

    ~FakeTerminationService() override {
        for (std::thread& thread : threads_) thread.join();
    }

    std::shared_ptr<TerminationAssertionHandle> createAssertion(
        const std::string& identifier, TerminationReason reason,
        AcquisitionHandler handler) override {
        created.emplace_back(identifier, reason);
        if (giveNoAssertion) return nullptr;
        auto assertion = std::make_shared<TerminationAssertionHandle>(identifier, reason);
        invalidations[assertion.get()] = 0;
        threads_.emplace_back([this, handler = std::move(handler)] {
            std::this_thread::sleep_for(answerAfter);
            answered = true;
            handler(failWith ? &*failWith : nullptr);
        });
        return assertion;
    }

    void invalidate(const std::shared_ptr<TerminationAssertionHandle>& assertion) override {
        ++invalidations[assertion.get()];
    }

  private:
    std::vector<std::thread> threads_;
};

class BTHApplicationTerminationAssertionTest : public ::testing::Test {
  protected:
    void SetUp() override { BTHApplicationTerminationAssertion::setTerminationService(service_); }
    void TearDown() override { BTHApplicationTerminationAssertion::setTerminationService(nullptr); }

    std::shared_ptr<FakeTerminationService> service_ = std::make_shared<FakeTerminationService>();
};

TEST_F(BTHApplicationTerminationAssertionTest, EachReasonReachesTheServiceAsItsOwn) {
    const std::pair<int, TerminationReason> reasons[] = {
        {0, TerminationReason::Installation},
        {1, TerminationReason::CacheDeletion},
        {255, TerminationReason::Critical},
    };
    for (const auto& [reason, expected] : reasons) {
        auto assertion =
            BTHApplicationTerminationAssertion::initWithBundleIdentifier("com.example.app", reason);
        ASSERT_TRUE(assertion) << reason;
        EXPECT_EQ(service_->created.back(),
                  std::make_pair(std::string("com.example.app"), expected));
        assertion->invalidate();
    }
}

TEST_F(BTHApplicationTerminationAssertionTest, CreationWaitsForALateAcquisition) {
    service_->answerAfter = 100ms;
    auto assertion = BTHApplicationTerminationAssertion::initWithBundleIdentifier("com.late", 0);
    EXPECT_TRUE(service_->answered);
    ASSERT_TRUE(assertion);
    assertion->invalidate();
}

TEST_F(BTHApplicationTerminationAssertionTest, InvalidateReleasesTheServicesAssertionOnce) {
    auto assertion = BTHApplicationTerminationAssertion::initWithBundleIdentifier("com.twice", 0);
    ASSERT_TRUE(assertion);
    ASSERT_EQ(service_->invalidations.size(), 1u);
    EXPECT_EQ(service_->invalidations.begin()->second, 0);
    assertion->invalidate();
    assertion->invalidate();
    EXPECT_EQ(service_->invalidations.begin()->second, 1);
}

TEST_F(BTHApplicationTerminationAssertionTest, AFailedAcquisitionGivesNullAndReleasesIt) {
    test::LogCapture log;
    service_->failWith = TerminationError{ETIMEDOUT, "processes still running"};
    service_->answerAfter = 20ms;
    EXPECT_FALSE(BTHApplicationTerminationAssertion::initWithBundleIdentifier("com.stuck", 0));
    ASSERT_EQ(service_->invalidations.size(), 1u);
    EXPECT_EQ(service_->invalidations.begin()->second, 1);
    EXPECT_TRUE(log.contains(3,
                             "Failed to acquire termination assertion for com.stuck : "
                             "processes still running"));
}

TEST_F(BTHApplicationTerminationAssertionTest, NoAssertionFromTheServiceGivesNull) {
    test::LogCapture log;
    service_->giveNoAssertion = true;
    EXPECT_FALSE(BTHApplicationTerminationAssertion::initWithBundleIdentifier("com.none", 1));
    EXPECT_TRUE(service_->invalidations.empty());
    EXPECT_TRUE(log.contains(3, "Failed to get GangwayApplicationTerminationAssertion"));
}

TEST_F(BTHApplicationTerminationAssertionTest, ProgrammingErrorsStopTheDaemon) {
    GTEST_FLAG_SET(death_test_style, "threadsafe");
    EXPECT_DEATH(BTHApplicationTerminationAssertion::initWithBundleIdentifier("com.bad", 7),
                 "Unknown reason: 7");
    EXPECT_TRUE(service_->created.empty());
    EXPECT_DEATH(
        {
            auto assertion =
                BTHApplicationTerminationAssertion::initWithBundleIdentifier("com.kept", 0);
            assertion.reset();
        },
        "nil == _termAssertion");
}

}  // namespace
}  // namespace berth
