#pragma once

// Checks that code runs on (or off) the queue that owns the state it touches. They work with any queue that has
// isCurrent() and label() (SerialQueue, SyncQueue), stay on in every build, and throw InternalInconsistency, which
// the request boundary turns into an internal-error answer.

#include <string_view>

namespace bexil::detail {

enum class QueueExpectation { OnQueue, OffQueue };
[[noreturn]] void failQueueAssertion(std::string_view label, QueueExpectation expected, const char* file, int line);

}  // namespace bexil::detail

#define BX_ASSERT_ON_QUEUE(queue)                                                                                   \
    do {                                                                                                            \
        const auto& bxAssertQueue_ = (queue);                                                                       \
        if (!bxAssertQueue_.isCurrent())                                                                            \
            ::bexil::detail::failQueueAssertion(bxAssertQueue_.label(), ::bexil::detail::QueueExpectation::OnQueue, \
                                                __FILE__, __LINE__);                                                \
    } while (false)

#define BX_ASSERT_NOT_ON_QUEUE(queue)                                                                                \
    do {                                                                                                             \
        const auto& bxAssertQueue_ = (queue);                                                                        \
        if (bxAssertQueue_.isCurrent())                                                                              \
            ::bexil::detail::failQueueAssertion(bxAssertQueue_.label(), ::bexil::detail::QueueExpectation::OffQueue, \
                                                __FILE__, __LINE__);                                                 \
    } while (false)
