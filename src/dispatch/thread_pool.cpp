#include "dispatch/thread_pool.h"

#include <algorithm>
#include <array>
#include <atomic>
#include <condition_variable>
#include <cstdint>
#include <deque>
#include <system_error>
#include <thread>
#include <vector>

#include "base/mutex.h"
#include "base/ring.h"

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
class PoolParking;

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
  // Puts a park's deadline on the timer. False once the timer has stopped.
  bool armDeadline(std::chrono::nanoseconds timeout, std::shared_ptr<PoolParking> parking);
  // A park ended before its deadline; its entry now holds a spent park.
  void parkEndedEarly();

 private:
  // A serial queue with work, or a lone closure of the concurrent queue.
  struct Ready {
    std::shared_ptr<PoolQueue> queue;
    Task task;
  };

  // A delayed closure, or the deadline of a park. A park that ends earlier leaves
  // its entry holding the spent park until the spent entries are half the heap, then
  // they all go at once: thousands of sessions that waited a moment for their backends
  // must not keep their parks (and the heap pages around them) for the whole interval.
  struct Delayed {
    SteadyTime due;
    std::uint64_t sequence;
    Task task;
    std::shared_ptr<PoolParking> parking;
  };
  static bool laterThan(const Delayed& a, const Delayed& b) {
    return a.due != b.due ? a.due > b.due : a.sequence > b.sequence;
  }

  void workerMain();
  void timerMain();
  bool startTimerLocked() VIREO_REQUIRES(timerMu_);
  bool popReadyLocked(Ready& out) VIREO_REQUIRES(mu_);
  bool hasReadyLocked() const VIREO_REQUIRES(mu_);
  bool shouldWakeLocked(bool hadReady) const VIREO_REQUIRES(mu_);
  bool onWorkerThread() const;

  const Options options_;
  std::atomic<bool> stopping_{false};
  // Closures submitted and due, plus pending parks, not yet finished; drain waits for zero.
  std::atomic<std::size_t> pending_{0};

  // mu_ guards ready_, workers_ and threads_ (and orders drainCv_ wakeups).
  mutable Mutex mu_;
  std::condition_variable workCv_;
  std::condition_variable drainCv_;
  std::array<std::deque<Ready>, kClassCount> ready_ VIREO_GUARDED_BY(mu_);
  std::vector<std::thread> workers_ VIREO_GUARDED_BY(mu_);
  std::size_t threads_ VIREO_GUARDED_BY(mu_) = 0;  // workers alive

  // timerMu_ guards delayed_ (a min-heap by due time), sequence_, timer_ and timerStop_.
  Mutex timerMu_;
  std::condition_variable timerCv_;
  std::vector<Delayed> delayed_ VIREO_GUARDED_BY(timerMu_);
  std::uint64_t sequence_ VIREO_GUARDED_BY(timerMu_) = 0;
  std::size_t spentParks_ VIREO_GUARDED_BY(timerMu_) = 0;  // about; reset when swept
  std::thread timer_ VIREO_GUARDED_BY(timerMu_);
  bool timerStop_ VIREO_GUARDED_BY(timerMu_) = false;
};

// One park of one queue. It holds the queue (and the timeout closure) until it ends,
// exactly once: resumed, timed out, or dropped at shutdown.
class PoolParking final : public Parking {
 public:
  // A park that never took effect: already spent.
  PoolParking() = default;
  PoolParking(std::shared_ptr<PoolQueue> queue, Task onTimeout)
      : queue_(std::move(queue)), onTimeout_(std::move(onTimeout)) {}

  bool resume(Task next) override { return end(std::move(next), false); }
  // The deadline passed.
  void expire() { end(nullptr, true); }
  // Shutdown: the queue's waiting closures are released unrun.
  void drop();
  bool spent() {
    MutexLock lock(mu_);
    return !queue_;
  }

 private:
  bool end(Task next, bool timedOut);

  Mutex mu_;  // guards queue_ and onTimeout_; queue_ is empty once the park has ended
  std::shared_ptr<PoolQueue> queue_ VIREO_GUARDED_BY(mu_);
  Task onTimeout_ VIREO_GUARDED_BY(mu_);
};

// A serial queue: its own FIFO, a flag telling whether it sits in (or is being run
// from) the pool's ready lists, and its pending park. Costs no thread, parked or not.
class PoolQueue final : public SerialQueue, public std::enable_shared_from_this<PoolQueue> {
 public:
  PoolQueue(std::shared_ptr<ThreadPoolDispatcher::Core> core, std::string label, QoS qos)
      : core_(std::move(core)), label_(std::move(label)), qos_(qos) {}

  void async(Task task) override {
    if (!task || core_->stopping()) return;
    core_->taskAdded();
    bool schedule = false;
    {
      MutexLock lock(mu_);
      fifo_.push_back(std::move(task));
      schedule = !scheduled_ && !park_;
      if (schedule) scheduled_ = true;
    }
    if (schedule) core_->submitQueue(shared_from_this(), qos_);
  }

  void asyncOrRun(Task task) override {
    if (!task || core_->stopping()) return;
    bool idle;
    {
      MutexLock lock(mu_);
      idle = !scheduled_ && !park_ && fifo_.empty();
      if (idle) scheduled_ = true;  // this thread runs the queue for the closure's time
    }
    if (!idle) return async(std::move(task));
    core_->taskAdded();
    runGuarded(task);
    task = nullptr;
    core_->taskFinished();
    bool schedule;
    {
      MutexLock lock(mu_);
      // What was submitted meanwhile is the pool's to run; a park the closure made
      // schedules the queue when it ends.
      schedule = !fifo_.empty() && !park_;
      if (!schedule) scheduled_ = false;
    }
    if (schedule) core_->submitQueue(shared_from_this(), qos_);
  }

  const std::string& label() const override { return label_; }
  QoS qos() const { return qos_; }
  ThreadPoolDispatcher::Core& core() const { return *core_; }

  std::shared_ptr<Parking> park(std::chrono::nanoseconds timeout, Task onTimeout) override {
    if (core_->stopping()) return std::make_shared<PoolParking>();
    auto parking = std::make_shared<PoolParking>(shared_from_this(), std::move(onTimeout));
    // The park counts as due work from now on, so drain waits for its end; the
    // closure it ends with takes the count over.
    core_->taskAdded();
    bool refused;
    {
      MutexLock lock(mu_);
      refused = park_ != nullptr;
      if (!refused) park_ = parking;
    }
    if (refused) {
      core_->taskFinished();
      parking = nullptr;  // releases onTimeout outside the lock
      return std::make_shared<PoolParking>();
    }
    if (!core_->armDeadline(timeout, parking)) parking->drop();
    return parking;
  }

  // Runs up to batch closures in order; true when more remain and the queue stays
  // scheduled (the caller puts it back in line). A park stops the batch between
  // closures and leaves the queue out of line until the park ends.
  bool runBatch(std::size_t batch) {
    for (std::size_t i = 0; i < batch && !core_->stopping(); ++i) {
      {
        Task task;
        {
          MutexLock lock(mu_);
          if (fifo_.empty() || park_) {
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
    MutexLock lock(mu_);
    if (fifo_.empty() || park_) scheduled_ = false;
    return scheduled_;
  }

  // The winner of the park's end: first (when not empty) goes to the head of the line.
  void unpark(const PoolParking* which, Task first) {
    std::shared_ptr<Parking> ended;  // released outside the lock
    bool schedule = false, counted = false;
    {
      MutexLock lock(mu_);
      if (park_.get() == which) ended = std::move(park_);
      if (first) {
        fifo_.push_front(std::move(first));
        counted = true;
      }
      schedule = !scheduled_ && !park_ && !fifo_.empty();
      if (schedule) scheduled_ = true;
    }
    if (!counted) core_->taskFinished();
    if (schedule) core_->submitQueue(shared_from_this(), qos_);
  }

  // Shutdown: a parked queue lets go of its park and of what waits behind it.
  void dropParked(const PoolParking* which) {
    std::shared_ptr<Parking> ended;
    Ring<Task> dropped;
    {
      MutexLock lock(mu_);
      if (park_.get() == which) ended = std::move(park_);
      dropped.swap(fifo_);
    }
    auto count = dropped.size() + 1;  // and the park itself
    dropped.clear();
    for (std::size_t i = 0; i < count; ++i) core_->taskFinished();
  }

  // After shutdown: drops what is queued.
  void clear() {
    Ring<Task> dropped;
    {
      MutexLock lock(mu_);
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
  Mutex mu_;  // guards fifo_, scheduled_ and park_
  Ring<Task> fifo_ VIREO_GUARDED_BY(mu_);
  bool scheduled_ VIREO_GUARDED_BY(mu_) = false;
  std::shared_ptr<PoolParking> park_ VIREO_GUARDED_BY(mu_);  // pending park; the queue runs nothing while set
};

bool PoolParking::end(Task next, bool timedOut) {
  std::shared_ptr<PoolQueue> queue;
  Task onTimeout;  // released here when resumed: its captures go as soon as the wait ends
  {
    MutexLock lock(mu_);
    queue = std::move(queue_);
    onTimeout = std::move(onTimeout_);
    onTimeout_ = nullptr;
  }
  if (!queue) return false;  // next is released unrun
  if (!timedOut) queue->core().parkEndedEarly();
  queue->unpark(this, timedOut ? std::move(onTimeout) : std::move(next));
  return true;
}

void PoolParking::drop() {
  std::shared_ptr<PoolQueue> queue;
  Task onTimeout;
  {
    MutexLock lock(mu_);
    queue = std::move(queue_);
    onTimeout = std::move(onTimeout_);
    onTimeout_ = nullptr;
  }
  if (queue) queue->dropParked(this);
}

namespace {
// The pool whose worker this thread is; null elsewhere.
thread_local const ThreadPoolDispatcher::Core* tlsCurrentCore = nullptr;
}  // namespace

ThreadPoolDispatcher::Core::Core(Options options) : options_([&] {
  if (options.workers == 0) options.workers = std::clamp(std::thread::hardware_concurrency(), 2u, 4u);
  if (options.batchSize == 0) options.batchSize = 1;
  return options;
}()) {}

ThreadPoolDispatcher::Core::~Core() { shutdown(); }

void ThreadPoolDispatcher::Core::start() {
  MutexLock lock(mu_);
  for (std::size_t i = 0; i < options_.workers; ++i) {
    try {
      workers_.emplace_back([this] { workerMain(); });
      ++threads_;
    } catch (const std::system_error&) {
      break;  // the workers that could be made carry the load
    }
  }
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

void ThreadPoolDispatcher::Core::workerMain() {
  tlsCurrentCore = this;
  MutexLock lock(mu_);
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
    lock.wait(workCv_);  // the loop checks again: stopping, or something ready
  }
  --threads_;
  lock.unlock();
  tlsCurrentCore = nullptr;
}

void ThreadPoolDispatcher::Core::taskFinished() {
  if (pending_.fetch_sub(1, std::memory_order_acq_rel) == 1) {
    MutexLock lock(mu_);
    drainCv_.notify_all();
  }
}

bool ThreadPoolDispatcher::Core::shouldWakeLocked(bool hadReady) const {
  // A worker that submits picks the item up itself once its closure returns, so
  // waking another thread only pays when there is already a backlog. This turns a
  // pipeline of small closures into batches instead of thread ping-pong; closures
  // never block for long (waits park their queue), so the item is not held up.
  return !onWorkerThread() || hadReady;
}

void ThreadPoolDispatcher::Core::submitQueue(std::shared_ptr<PoolQueue> queue, QoS qos) {
  bool wake = false;
  {
    MutexLock lock(mu_);
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
    MutexLock lock(mu_);
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

bool ThreadPoolDispatcher::Core::startTimerLocked() {
  if (timer_.joinable()) return true;
  try {
    timer_ = std::thread([this] { timerMain(); });
  } catch (const std::system_error&) {
    return false;
  }
  return true;
}

void ThreadPoolDispatcher::Core::submitDelayed(std::chrono::nanoseconds delay, Task task) {
  if (!task || stopping()) return;
  if (delay <= std::chrono::nanoseconds::zero()) {
    submitTask(std::move(task), kLowPriorityClass);
    return;
  }
  auto due = std::chrono::steady_clock::now() + std::chrono::duration_cast<std::chrono::steady_clock::duration>(delay);
  MutexLock lock(timerMu_);
  if (timerStop_ || !startTimerLocked()) return;
  bool earliest = delayed_.empty() || due < delayed_.front().due;
  delayed_.push_back(Delayed{due, sequence_++, std::move(task), nullptr});
  std::push_heap(delayed_.begin(), delayed_.end(), laterThan);
  if (earliest) timerCv_.notify_one();
}

bool ThreadPoolDispatcher::Core::armDeadline(std::chrono::nanoseconds timeout, std::shared_ptr<PoolParking> parking) {
  auto due = std::chrono::steady_clock::now() +
             std::chrono::duration_cast<std::chrono::steady_clock::duration>(std::max(timeout, std::chrono::nanoseconds::zero()));
  bool noTimer = false;
  {
    MutexLock lock(timerMu_);
    if (timerStop_) return false;
    if (startTimerLocked()) {
      bool earliest = delayed_.empty() || due < delayed_.front().due;
      delayed_.push_back(Delayed{due, sequence_++, nullptr, parking});
      std::push_heap(delayed_.begin(), delayed_.end(), laterThan);
      if (earliest) timerCv_.notify_one();
    } else {
      noTimer = true;
    }
  }
  // Without a timer thread no deadline could ever pass: it passes now.
  if (noTimer) parking->expire();
  return true;
}

void ThreadPoolDispatcher::Core::parkEndedEarly() {
  constexpr std::size_t kSweepAtLeast = 64;
  MutexLock lock(timerMu_);
  if (++spentParks_ < kSweepAtLeast || spentParks_ * 2 < delayed_.size()) return;
  std::erase_if(delayed_, [](const Delayed& d) { return d.parking && d.parking->spent(); });
  std::make_heap(delayed_.begin(), delayed_.end(), laterThan);
  spentParks_ = 0;
}

void ThreadPoolDispatcher::Core::timerMain() {
  MutexLock lock(timerMu_);
  while (!timerStop_) {
    if (delayed_.empty()) {
      lock.wait(timerCv_);
      continue;
    }
    // A copy: the heap may grow, and move its elements, while this thread waits.
    SteadyTime due = delayed_.front().due;
    if (due > std::chrono::steady_clock::now()) {
      lock.waitUntil(timerCv_, due);
      continue;
    }
    std::pop_heap(delayed_.begin(), delayed_.end(), laterThan);
    Delayed entry = std::move(delayed_.back());
    delayed_.pop_back();
    lock.unlock();
    if (entry.parking) {
      entry.parking->expire();  // a no-op when the park has already ended
    } else {
      submitTask(std::move(entry.task), kLowPriorityClass);
    }
    entry = Delayed{};
    lock.lock();
  }
}

bool ThreadPoolDispatcher::Core::drain(std::chrono::milliseconds budget) {
  MutexLock lock(mu_);
  const auto deadline = std::chrono::steady_clock::now() + budget;
  while (pending_.load(std::memory_order_acquire) != 0)
    if (lock.waitUntil(drainCv_, deadline) == std::cv_status::timeout) return pending_.load(std::memory_order_acquire) == 0;
  return true;
}

std::size_t ThreadPoolDispatcher::Core::workerCount() const {
  MutexLock lock(mu_);
  return threads_;
}

void ThreadPoolDispatcher::Core::shutdown() {
  // A closure cannot wait for its own worker; the owner's later call joins.
  if (onWorkerThread()) {
    stopping_.store(true, std::memory_order_release);
    workCv_.notify_all();
    return;
  }
  std::vector<std::thread> workers;
  {
    MutexLock lock(mu_);
    stopping_.store(true, std::memory_order_release);
    workers.swap(workers_);
  }
  workCv_.notify_all();
  std::thread timer;
  std::vector<Delayed> delayed;
  {
    MutexLock lock(timerMu_);
    timerStop_ = true;
    timer.swap(timer_);
    delayed.swap(delayed_);
  }
  timerCv_.notify_all();
  for (auto& w : workers) w.join();
  if (timer.joinable()) timer.join();
  // Every pending park has its deadline here, so none is left behind. Dropped
  // outside the locks: a closure's captures may submit again while dying.
  for (auto& entry : delayed)
    if (entry.parking) entry.parking->drop();
  delayed.clear();

  std::array<std::deque<Ready>, kClassCount> left;
  {
    MutexLock lock(mu_);
    left.swap(ready_);
  }
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
