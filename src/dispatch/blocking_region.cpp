#include "dispatch/dispatch.h"

namespace vireo {

namespace {
// The observer of the pool that owns this thread; null on threads no pool owns.
thread_local BlockingRegion::Observer* tlsObserver = nullptr;
}  // namespace

BlockingRegion::BlockingRegion() : observer_(tlsObserver) {
  if (observer_) observer_->blockingBegan();
}

BlockingRegion::~BlockingRegion() {
  if (observer_) observer_->blockingEnded();
}

void BlockingRegion::setThreadObserver(Observer* observer) { tlsObserver = observer; }

}  // namespace vireo
