#pragma once

/// Allocation failures: interposes operator new and malloc.
namespace test {

/// Makes the `number`th allocation of this thread, counted from 1, fail for the lifetime of the
/// object.
class FailingMemory {
 public:
    explicit FailingMemory(int number);
    ~FailingMemory();

    FailingMemory(const FailingMemory&) = delete;
    FailingMemory& operator=(const FailingMemory&) = delete;

    bool hasFailed() const;
};

}  // namespace test
