#include "dispatch/thread_pool.h"

#include <algorithm>
#include <array>
#include <atomic>
#include <condition_variable>
#include <cstdint>
#include <deque>
#include <list>
#include <mutex>
#include <system_error>
#include <thread>
#include <vector>

namespace vireo {

namespace {

constexpr std::size_t kClassCount = 5;
// The shared low-priority queue runs one step below the default class.
constexpr QoS kLowPriorityClass = QoS::Utility;

std::size_t classIndex(QoS qos) {
  auto i = static_cast<std::size_t>(qos);
  return i < kClassCount ? i : kClassCount - 1;
}

// A closure's failure stays inside the closure: the pool and its queue go on.
void runGuarded(Task& task) noexcept {
  try {
    task();
  } catch (...) {
  }
}

using SteadyTime = std::chrono::steady_clock::time_point;

}  // namespace

class PoolQueue;

class ThreadPoolDispatcher::Core {
 public:
  explicit Core(Options options);
  ~Core();
  Core(const Core&) = delete;
  Core& operator=(const Core&) = delete;

  void start();
  void shutdown();
  bool drain(std::chrono::milliseconds budget);
  std::size_t workerCount() const;

  bool stopping() const { return stopping_.load(std::memory_order_acquire); }
  std::size_t batchSize() const { return options_.batchSize; }
  void taskAdded() { pending_.fetch_add(1, std::memory_order_relaxed); }
  void taskFinished();

  // The queue just became scheduled: it has work and is in no ready list.
  void submitQueue(std::shared_ptr<PoolQueue> queue, QoS qos);
  // One closure on its own, free to run beside any other.
  void submitTask(Task task, QoS qos);
  void submitDelayed(std::chrono::nanoseconds delay, Task task);

 private:
  // A serial queue with work, or a lone closure of the concurrent queue.
  struct Ready {
    std::shared_ptr<PoolQueue> queue;
    Task task;
  };

  class Worker final : public BlockingRegion::Observer {
   public:
    explicit Worker(Core* core) : core_(core) {}
    void blockingBegan() override {
      if (depth_++ == 0) core_->blockingBegan();
    }
    void blockingEnded() override {
      if (--depth_ == 0) core_->blockingEnded();
    }
    std::thread thread;
    bool finished = false;  // guarded by Core::mu_

   private:
    Core* core_;
    int depth_ = 0;  // touched only by the worker's own thread
  };

  struct Delayed {
    SteadyTime due;
    std::uint64_t sequence;
    Task task;
  };
  static bool laterThan(const Delayed& a, const Delayed& b) {
    return a.due != b.due ? a.due > b.due : a.sequence > b.sequence;
  }

  void workerMain(Worker* self);
  void timerMain();
  void blockingBegan();
  void blockingEnded();
  bool popReadyLocked(Ready& out);
  bool hasReadyLocked() const;
  bool shouldWakeLocked(bool hadReady) const;
  // Starts one worker; false when the thread could not be made.
  bool spawnLocked();
  std::vector<std::unique_ptr<Worker>> takeFinishedLocked();
  bool onWorkerThread() const;

  const Options options_;
  std::atomic<bool> stopping_{false};
  // Closures submitted and due but not yet finished; drain waits for zero.
  std::atomic<std::size_t> pending_{0};

  // mu_ guards ready_, workers_, threads_ and blocked_ (and orders drainCv_ wakeups).
  mutable std::mutex mu_;
  std::condition_variable workCv_;
  std::condition_variable drainCv_;
  std::array<std::deque<Ready>, kClassCount> ready_;
  std::list<std::unique_ptr<Worker>> workers_;
  std::size_t threads_ = 0;  // workers alive
  std::size_t blocked_ = 0;  // workers inside a blocking region

  // timerMu_ guards delayed_ (a min-heap by due time), sequence_, timer_ and timerStop_.
  std::mutex timerMu_;
  std::condition_variable timerCv_;
  std::vector<Delayed> delayed_;
  std::uint64_t sequence_ = 0;
  std::thread timer_;
  bool timerStop_ = false;
};

// A serial queue: its own FIFO and a flag telling whether it sits in (or is being
// run from) the pool's ready lists. Costs no thread.
class PoolQueue final : public SerialQueue, public std::enable_shared_from_this<PoolQueue> {
 public:
  PoolQueue(std::shared_ptr<ThreadPoolDispatcher::Core> core, std::string label, QoS qos)
      : core_(std::move(core)), label_(std::move(label)), qos_(qos) {}

  void async(Task task) override {
    if (!task || core_->stopping()) return;
    core_->taskAdded();
    bool schedule = false;
    {
      std::lock_guard lock(mu_);
      fifo_.push_back(std::move(task));
      schedule = !scheduled_;
      scheduled_ = true;
    }
    if (schedule) core_->submitQueue(shared_from_this(), qos_);
  }

  const std::string& label() const override { return label_; }
  QoS qos() const { return qos_; }

  // Runs up to batch closures in order; true when more remain and the queue stays
  // scheduled (the caller puts it back in line).
  bool runBatch(std::size_t batch) {
    for (std::size_t i = 0; i < batch && !core_->stopping(); ++i) {
      {
        Task task;
        {
          std::lock_guard lock(mu_);
          if (fifo_.empty()) {
            scheduled_ = false;
            return false;
          }
          task = std::move(fifo_.front());
          fifo_.pop_front();
        }
        runGuarded(task);
      }  // the closure's captures are released before it counts as finished
      core_->taskFinished();
    }
    std::lock_guard lock(mu_);
    if (fifo_.empty()) scheduled_ = false;
    return scheduled_;
  }

  // After shutdown: drops what is queued.
  void clear() {
    std::deque<Task> dropped;
    {
      std::lock_guard lock(mu_);
      dropped.swap(fifo_);
      scheduled_ = false;
    }
    auto count = dropped.size();
    dropped.clear();
    for (std::size_t i = 0; i < count; ++i) core_->taskFinished();
  }

 private:
  const std::shared_ptr<ThreadPoolDispatcher::Core> core_;
  const std::string label_;
  const QoS qos_;
  std::mutex mu_;  // guards fifo_ and scheduled_
  std::deque<Task> fifo_;
  bool scheduled_ = false;
};

namespace {
// The pool whose worker this thread is; null elsewhere.
thread_local const ThreadPoolDispatcher::Core* tlsCurrentCore = nullptr;
}  // namespace

ThreadPoolDispatcher::Core::Core(Options options) : options_([&] {
  if (options.coreWorkers == 0) options.coreWorkers = std::max(2u, std::thread::hardware_concurrency());
  if (options.batchSize == 0) options.batchSize = 1;
  return options;
}()) {}

ThreadPoolDispatcher::Core::~Core() { shutdown(); }

void ThreadPoolDispatcher::Core::start() {
  std::lock_guard lock(mu_);
  for (std::size_t i = 0; i < options_.coreWorkers; ++i) spawnLocked();
}

bool ThreadPoolDispatcher::Core::spawnLocked() {
  auto worker = std::make_unique<Worker>(this);
  Worker* raw = worker.get();
  try {
    worker->thread = std::thread([this, raw] { workerMain(raw); });
  } catch (const std::system_error&) {
    return false;
  }
  workers_.push_back(std::move(worker));
  ++threads_;
  return true;
}

std::vector<std::unique_ptr<ThreadPoolDispatcher::Core::Worker>> ThreadPoolDispatcher::Core::takeFinishedLocked() {
  std::vector<std::unique_ptr<Worker>> done;
  for (auto it = workers_.begin(); it != workers_.end();) {
    if ((*it)->finished) {
      done.push_back(std::move(*it));
      it = workers_.erase(it);
    } else {
      ++it;
    }
  }
  return done;
}

bool ThreadPoolDispatcher::Core::onWorkerThread() const { return tlsCurrentCore == this; }

bool ThreadPoolDispatcher::Core::hasReadyLocked() const {
  return std::any_of(ready_.begin(), ready_.end(), [](const auto& list) { return !list.empty(); });
}

bool ThreadPoolDispatcher::Core::popReadyLocked(Ready& out) {
  for (auto& list : ready_) {
    if (!list.empty()) {
      out = std::move(list.front());
      list.pop_front();
      return true;
    }
  }
  return false;
}

void ThreadPoolDispatcher::Core::workerMain(Worker* self) {
  tlsCurrentCore = this;
  BlockingRegion::setThreadObserver(self);
  std::unique_lock lock(mu_);
  while (!stopping()) {
    Ready item;
    if (popReadyLocked(item)) {
      lock.unlock();
      if (item.queue) {
        if (item.queue->runBatch(options_.batchSize)) {
          // More work remains: back to the end of its class, so others get a turn.
          auto index = classIndex(item.queue->qos());
          lock.lock();
          ready_[index].push_back(std::move(item));
          continue;
        }
      } else {
        runGuarded(item.task);
        item.task = nullptr;
        taskFinished();
      }
      item = Ready{};
      lock.lock();
      continue;
    }
    bool woken = workCv_.wait_for(lock, options_.extraIdleTimeout, [&] { return stopping() || hasReadyLocked(); });
    // A worker that found nothing to do for a while leaves if enough others remain.
    if (!woken && threads_ - blocked_ > options_.coreWorkers) break;
  }
  self->finished = true;
  --threads_;
  lock.unlock();
  BlockingRegion::setThreadObserver(nullptr);
  tlsCurrentCore = nullptr;
}

void ThreadPoolDispatcher::Core::blockingBegan() {
  std::vector<std::unique_ptr<Worker>> finished;
  {
    std::lock_guard lock(mu_);
    ++blocked_;
    if (stopping()) return;
    // Keep the core number of workers free to run queues, within the cap.
    if (threads_ - blocked_ < options_.coreWorkers && threads_ < options_.coreWorkers + options_.maxExtraWorkers) {
      finished = takeFinishedLocked();
      spawnLocked();
    } else if (hasReadyLocked()) {
      // This worker submitted without waking anyone; an idle worker takes over.
      workCv_.notify_one();
    }
  }
  for (auto& w : finished) w->thread.join();
}

void ThreadPoolDispatcher::Core::blockingEnded() {
  std::lock_guard lock(mu_);
  --blocked_;
}

void ThreadPoolDispatcher::Core::taskFinished() {
  if (pending_.fetch_sub(1, std::memory_order_acq_rel) == 1) {
    std::lock_guard lock(mu_);
    drainCv_.notify_all();
  }
}

bool ThreadPoolDispatcher::Core::shouldWakeLocked(bool hadReady) const {
  // A worker that submits picks the item up itself once its closure returns, so
  // waking another thread only pays when there is already a backlog. This turns a
  // pipeline of small closures into batches instead of thread ping-pong. A worker
  // that goes on to block hands its backlog over in blockingBegan().
  return !onWorkerThread() || hadReady;
}

void ThreadPoolDispatcher::Core::submitQueue(std::shared_ptr<PoolQueue> queue, QoS qos) {
  bool wake = false;
  {
    std::lock_guard lock(mu_);
    if (!stopping()) {
      wake = shouldWakeLocked(hasReadyLocked());
      ready_[classIndex(qos)].push_back(Ready{std::move(queue), nullptr});
      queue = nullptr;
    }
  }
  if (queue) {
    queue->clear();
    return;
  }
  if (wake) workCv_.notify_one();
}

void ThreadPoolDispatcher::Core::submitTask(Task task, QoS qos) {
  if (!task || stopping()) return;
  taskAdded();
  bool wake = false;
  {
    std::lock_guard lock(mu_);
    if (!stopping()) {
      wake = shouldWakeLocked(hasReadyLocked());
      ready_[classIndex(qos)].push_back(Ready{nullptr, std::move(task)});
      task = nullptr;
    }
  }
  if (task) {
    task = nullptr;
    taskFinished();
    return;
  }
  if (wake) workCv_.notify_one();
}

void ThreadPoolDispatcher::Core::submitDelayed(std::chrono::nanoseconds delay, Task task) {
  if (!task || stopping()) return;
  if (delay <= std::chrono::nanoseconds::zero()) {
    submitTask(std::move(task), kLowPriorityClass);
    return;
  }
  auto due = std::chrono::steady_clock::now() + std::chrono::duration_cast<std::chrono::steady_clock::duration>(delay);
  std::lock_guard lock(timerMu_);
  if (timerStop_) return;
  if (!timer_.joinable()) {
    try {
      timer_ = std::thread([this] { timerMain(); });
    } catch (const std::system_error&) {
      return;
    }
  }
  bool earliest = delayed_.empty() || due < delayed_.front().due;
  delayed_.push_back(Delayed{due, sequence_++, std::move(task)});
  std::push_heap(delayed_.begin(), delayed_.end(), laterThan);
  if (earliest) timerCv_.notify_one();
}

void ThreadPoolDispatcher::Core::timerMain() {
  std::unique_lock lock(timerMu_);
  while (!timerStop_) {
    if (delayed_.empty()) {
      timerCv_.wait(lock);
      continue;
    }
    // A copy: the heap may grow, and move its elements, while this thread waits.
    SteadyTime due = delayed_.front().due;
    if (due > std::chrono::steady_clock::now()) {
      timerCv_.wait_until(lock, due);
      continue;
    }
    std::pop_heap(delayed_.begin(), delayed_.end(), laterThan);
    Task task = std::move(delayed_.back().task);
    delayed_.pop_back();
    lock.unlock();
    submitTask(std::move(task), kLowPriorityClass);
    lock.lock();
  }
}

bool ThreadPoolDispatcher::Core::drain(std::chrono::milliseconds budget) {
  std::unique_lock lock(mu_);
  return drainCv_.wait_for(lock, budget, [&] { return pending_.load(std::memory_order_acquire) == 0; });
}

std::size_t ThreadPoolDispatcher::Core::workerCount() const {
  std::lock_guard lock(mu_);
  return threads_;
}

void ThreadPoolDispatcher::Core::shutdown() {
  // A closure cannot wait for its own worker; the owner's later call joins.
  if (onWorkerThread()) {
    stopping_.store(true, std::memory_order_release);
    workCv_.notify_all();
    return;
  }
  std::list<std::unique_ptr<Worker>> workers;
  {
    std::lock_guard lock(mu_);
    stopping_.store(true, std::memory_order_release);
    workers.swap(workers_);
  }
  workCv_.notify_all();
  std::thread timer;
  std::vector<Delayed> delayed;
  {
    std::lock_guard lock(timerMu_);
    timerStop_ = true;
    timer.swap(timer_);
    delayed.swap(delayed_);
  }
  timerCv_.notify_all();
  for (auto& w : workers) w->thread.join();
  if (timer.joinable()) timer.join();
  delayed.clear();

  std::array<std::deque<Ready>, kClassCount> left;
  {
    std::lock_guard lock(mu_);
    left.swap(ready_);
  }
  // Dropped outside the lock: a closure's captures may submit again while dying.
  for (auto& list : left) {
    for (auto& item : list) {
      if (item.queue) {
        item.queue->clear();
      } else {
        item.task = nullptr;
        taskFinished();
      }
    }
    list.clear();
  }
}

ThreadPoolDispatcher::ThreadPoolDispatcher() : ThreadPoolDispatcher(Options{}) {}

ThreadPoolDispatcher::ThreadPoolDispatcher(Options options) : core_(std::make_shared<Core>(options)) {
  core_->start();
}

ThreadPoolDispatcher::~ThreadPoolDispatcher() { core_->shutdown(); }

std::shared_ptr<SerialQueue> ThreadPoolDispatcher::makeSerialQueue(std::string label, QoS qos) {
  return std::make_shared<PoolQueue>(core_, std::move(label), qos);
}

void ThreadPoolDispatcher::asyncLowPriority(std::chrono::nanoseconds delay, Task task) {
  core_->submitDelayed(delay, std::move(task));
}

bool ThreadPoolDispatcher::drain(std::chrono::milliseconds budget) { return core_->drain(budget); }

void ThreadPoolDispatcher::shutdown() { core_->shutdown(); }

std::size_t ThreadPoolDispatcher::workerCount() const { return core_->workerCount(); }

}  // namespace vireo
