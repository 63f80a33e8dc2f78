#pragma once
// A serial work queue: an Asio strand over a worker pool. Work runs one item at a
// time in submission order on whichever pool thread is free.

#include <asio/io_context.hpp>
#include <asio/strand.hpp>

#include "platform/WorkQueue.h"
#include "platform/linux/AsioOutstandingWork.h"

namespace mx {

class AsioSerialQueue final : public WorkQueue {
public:
    AsioSerialQueue(std::string label, const asio::io_context::executor_type& executor, AsioOutstandingWork& work);

    const std::string& label() const override { return label_; }
    void dispatch(UniqueFunction<void()> work) override;
    void dispatchAfter(std::chrono::nanoseconds delay, UniqueFunction<void()> work) override;
    void dispatchTimeout(std::chrono::nanoseconds delay, UniqueFunction<void()> work) override;
    bool isCurrent() const override { return strand_.running_in_this_thread(); }

private:
    std::string label_;
    asio::strand<asio::io_context::executor_type> strand_;
    AsioOutstandingWork& work_;
};

} // namespace mx
