// Makes the n-th allocation of the calling thread fail, and counts blocks; or that of all other
// threads together, for servers with threads of their own.
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

// The same for all threads but the one that makes it, which plays the client. One at a time.
class AllocationFaultElsewhere {
 public:
  // The allocations number `fail_at` to `fail_at` + `times` - 1 fail, counted from 1; 0 none.
  explicit AllocationFaultElsewhere(long fail_at, long times = 1) noexcept;
  ~AllocationFaultElsewhere();
  AllocationFaultElsewhere(const AllocationFaultElsewhere&) = delete;
  AllocationFaultElsewhere& operator=(const AllocationFaultElsewhere&) = delete;

  void disarm() noexcept;

  [[nodiscard]] bool hit() const noexcept;
  [[nodiscard]] long allocations() const noexcept;
};

}  // namespace orv::test
