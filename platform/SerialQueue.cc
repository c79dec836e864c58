#include <utility>

#include "platform/Queue.h"
#include "platform/QueueCore.h"

namespace storix {

namespace {

class SerialQueueOnExecutor final : public SerialQueue {
 public:
  SerialQueueOnExecutor(Executor &executor, std::string label)
      : SerialQueue(std::move(label)), core_(executor, *this) {}

  void async(Task task) override { core_.async(std::move(task), QueueCore::Kind::exclusive); }
  void suspend() override { core_.suspend(); }
  void resume() override { core_.resume(); }
  void close() { core_.close(); }

 protected:
  void runSync(TaskReference task) override { core_.sync(task, QueueCore::Kind::exclusive); }

 private:
  QueueCore core_;
};

}  // namespace

std::shared_ptr<SerialQueue> SerialQueue::create(Executor &executor, std::string label) {
  return std::shared_ptr<SerialQueueOnExecutor>(new SerialQueueOnExecutor(executor, std::move(label)),
                                                [](SerialQueueOnExecutor *queue) { queue->close(); });
}

}  // namespace storix
