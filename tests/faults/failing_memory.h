#pragma once

/// Memory that runs out at a chosen moment: stands in front of the operators that the library gets its memory
/// by.
namespace test {

/// While the object lives, the `number`th request of this thread for memory, counted from 1, fails.
class FailingMemory {
 public:
    explicit FailingMemory(int number);
    ~FailingMemory();

    FailingMemory(const FailingMemory&) = delete;
    FailingMemory& operator=(const FailingMemory&) = delete;

    bool hasFailed() const;
};

}  // namespace test
