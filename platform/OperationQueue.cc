#include <utility>

#include "platform/Queue.h"
#include "platform/QueueCore.h"

namespace storix {

namespace {

class OperationQueueOnExecutor final : public OperationQueue {
 public:
  OperationQueueOnExecutor(Executor &executor, std::string name)
      : OperationQueue(std::move(name)), core_(executor, *this, defaultMaximumConcurrency) {}

  void addOperation(Task operation) override { core_.async(std::move(operation), QueueCore::Kind::plain); }
  void setMaximumConcurrency(std::size_t maximum) override { core_.setMaximumConcurrency(maximum); }
  void close() { core_.close(); }

 private:
  QueueCore core_;
};

}  // namespace

std::shared_ptr<OperationQueue> OperationQueue::create(Executor &executor, std::string name) {
  return std::shared_ptr<OperationQueueOnExecutor>(new OperationQueueOnExecutor(executor, std::move(name)),
                                                   [](OperationQueueOnExecutor *queue) { queue->close(); });
}

const OperationQueue *OperationQueue::current() { return QueueCore::currentOperationQueue(); }

}  // namespace storix
