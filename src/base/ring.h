// Ring: a double-ended FIFO that holds no memory while it is empty.
//
// The daemon keeps a queue of closures for every session and a list of kept payloads
// for every started one; most of them are empty most of the time, and an empty
// std::deque still takes about 600 bytes. A Ring grows by doubling and lets its buffer
// go whenever it empties. Elements must be default-constructible: a slot outside the
// live range holds a default value.
#pragma once

#include <cstddef>
#include <iterator>
#include <memory>
#include <utility>

namespace vireo {

template <class T>
class Ring {
 public:
  Ring() = default;
  Ring(Ring&& other) noexcept { swap(other); }
  Ring& operator=(Ring&& other) noexcept {
    Ring(std::move(other)).swap(*this);
    return *this;
  }
  Ring(const Ring&) = delete;
  Ring& operator=(const Ring&) = delete;

  bool empty() const noexcept { return size_ == 0; }
  std::size_t size() const noexcept { return size_; }

  T& front() { return at(0); }
  const T& front() const { return at(0); }
  T& back() { return at(size_ - 1); }

  void push_back(T value) {
    reserveOneMore();
    at(size_) = std::move(value);
    ++size_;
  }
  void push_front(T value) {
    reserveOneMore();
    head_ = (head_ + capacity_ - 1) & (capacity_ - 1);
    at(0) = std::move(value);
    ++size_;
  }
  void pop_front() {
    at(0) = T();  // what the element owns goes now, not when the slot is reused
    head_ = (head_ + 1) & (capacity_ - 1);
    if (--size_ == 0) clear();
  }
  void clear() noexcept {
    slots_.reset();
    capacity_ = head_ = size_ = 0;
  }
  void swap(Ring& other) noexcept {
    std::swap(slots_, other.slots_);
    std::swap(capacity_, other.capacity_);
    std::swap(head_, other.head_);
    std::swap(size_, other.size_);
  }

  template <class R, class V>
  class Iterator {
   public:
    using iterator_category = std::forward_iterator_tag;
    using value_type = T;
    using difference_type = std::ptrdiff_t;
    using pointer = V*;
    using reference = V&;
    Iterator(R* ring, std::size_t index) : ring_(ring), index_(index) {}
    V& operator*() const { return ring_->at(index_); }
    V* operator->() const { return &ring_->at(index_); }
    Iterator& operator++() {
      ++index_;
      return *this;
    }
    Iterator operator++(int) { return Iterator(ring_, index_++); }
    bool operator==(const Iterator& o) const { return index_ == o.index_; }

   private:
    R* ring_;
    std::size_t index_;
  };
  using iterator = Iterator<Ring, T>;
  using const_iterator = Iterator<const Ring, const T>;
  iterator begin() { return {this, 0}; }
  iterator end() { return {this, size_}; }
  const_iterator begin() const { return {this, 0}; }
  const_iterator end() const { return {this, size_}; }

 private:
  // The i-th element from the front; the capacity is a power of two.
  T& at(std::size_t i) { return slots_[(head_ + i) & (capacity_ - 1)]; }
  const T& at(std::size_t i) const { return slots_[(head_ + i) & (capacity_ - 1)]; }

  void reserveOneMore() {
    if (size_ < capacity_) return;
    const std::size_t grown = capacity_ ? capacity_ * 2 : 4;
    auto slots = std::make_unique<T[]>(grown);
    for (std::size_t i = 0; i < size_; ++i) slots[i] = std::move(at(i));
    slots_ = std::move(slots);
    capacity_ = grown;
    head_ = 0;
  }

  std::unique_ptr<T[]> slots_;
  std::size_t capacity_ = 0;
  std::size_t head_ = 0;
  std::size_t size_ = 0;
};

}  // namespace vireo
