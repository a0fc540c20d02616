#include <gtest/gtest.h>

#include <vector>

#include "Daemon/Concurrency/VSLCommandQueue.h"

using namespace vsl;

namespace {

struct Recorder {
    std::vector<int> ran;
};

class TestCommand : public VSLCommand {
public:
    TestCommand(Recorder& r, int id, uint64_t failWith = 1, std::shared_ptr<VSLCommand> insertWhenRun = nullptr)
        : r_(r), id_(id), failWith_(failWith), insert_(std::move(insertWhenRun)) {}
    uint64_t command() const override { return 3; }
    bool fromQueue(const std::shared_ptr<VSLCommandQueue>& queue, uint64_t* code) override {
        r_.ran.push_back(id_);
        if (insert_) queue->insertCommand(insert_);
        if (failWith_ != 1) {
            *code = failWith_;
            return false;
        }
        return true;
    }

private:
    Recorder& r_;
    int id_;
    uint64_t failWith_;
    std::shared_ptr<VSLCommand> insert_;
};

}  // namespace

TEST(CommandQueue, DrainsInOrderAndStopsAtTheFirstFailure) {
    uint64_t code = 1;
    auto empty = VSLCommandQueue::create();
    EXPECT_TRUE(empty->executeAllUntilExhaustedOrError(&code)) << "an empty queue drains";
    EXPECT_EQ(1u, code) << "and reports nothing";

    Recorder r;
    auto q = VSLCommandQueue::create();
    // Command 1 inserts 4 while it runs: 4 runs in the same drain, after 2 and 3.
    q->insertCommand(std::make_shared<TestCommand>(r, 1, 1, std::make_shared<TestCommand>(r, 4)));
    q->insertCommand(std::make_shared<TestCommand>(r, 2));
    q->insertCommand(std::make_shared<TestCommand>(r, 3));
    EXPECT_TRUE(q->executeAllUntilExhaustedOrError(&code));
    EXPECT_EQ((std::vector<int>{1, 2, 3, 4}), r.ran);

    r.ran.clear();
    q->insertCommand(std::make_shared<TestCommand>(r, 5));
    q->insertCommand(std::make_shared<TestCommand>(r, 6, 28));
    q->insertCommand(std::make_shared<TestCommand>(r, 7));
    code = 1;
    EXPECT_FALSE(q->executeAllUntilExhaustedOrError(&code));
    EXPECT_EQ(28u, code) << "the failing command's code becomes the result";
    EXPECT_EQ((std::vector<int>{5, 6}), r.ran);
    EXPECT_EQ(1u, q->pendingCount()) << "what follows a failure stays unexecuted";

    code = 1;
    EXPECT_FALSE(empty->executeNextCommandWithError(&code));
    EXPECT_EQ(kVSLCommandQueueExhausted, code);
}
