#include <utility>

#include "platform/Queue.h"
#include "platform/QueueCore.h"

namespace storix {

namespace {

class ConcurrentQueueOnExecutor final : public ConcurrentQueue {
 public:
  ConcurrentQueueOnExecutor(Executor &executor, std::string label)
      : ConcurrentQueue(std::move(label)), core_(executor, *this) {}

  void async(Task task) override { core_.async(std::move(task), QueueCore::Kind::plain); }
  void asyncBarrier(Task task) override { core_.async(std::move(task), QueueCore::Kind::exclusive); }
  void suspend() override { core_.suspend(); }
  void resume() override { core_.resume(); }
  void close() { core_.close(); }

 protected:
  void runSync(TaskReference task) override { core_.sync(task, QueueCore::Kind::plain); }
  void runSyncBarrier(TaskReference task) override { core_.sync(task, QueueCore::Kind::exclusive); }

 private:
  QueueCore core_;
};

}  // namespace

std::shared_ptr<ConcurrentQueue> ConcurrentQueue::create(Executor &executor, std::string label) {
  return std::shared_ptr<ConcurrentQueueOnExecutor>(new ConcurrentQueueOnExecutor(executor, std::move(label)),
                                                    [](ConcurrentQueueOnExecutor *queue) { queue->close(); });
}

}  // namespace storix
