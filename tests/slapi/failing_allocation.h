// Makes the n-th allocation of the calling thread fail, and counts blocks.
//
// The program that links this has its malloc family and its operator new replaced; without an armed
// fault they only pass on.
#pragma once

namespace orv::test {

class AllocationFault {
 public:
  // Arms for the object's lifetime: the allocation number `fail_at` fails, counted from 1; 0 none.
  explicit AllocationFault(long fail_at) noexcept;
  ~AllocationFault();
  AllocationFault(const AllocationFault&) = delete;
  AllocationFault& operator=(const AllocationFault&) = delete;

  // Stops failing and counting.
  void disarm() noexcept;

  [[nodiscard]] bool hit() const noexcept;
  [[nodiscard]] long allocations() const noexcept;
  // Blocks allocated since, less those released.
  [[nodiscard]] long balance() const noexcept;
};

}  // namespace orv::test
