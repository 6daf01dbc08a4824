#include "platform/host/Allocation.h"

#include <malloc.h>

namespace sable::platform::host {

void shareOneHeap() {
  // A heap a thread costs memory that only its own next burst uses again, and freeing on another
  // thread than the one that allocated, which is how an answer travels, contends all the same.
  ::mallopt(M_ARENA_MAX, 1);
  // Reading one answer takes more than the default 128 KiB: its pages would be given back, and
  // faulted in again for the next one.
  constexpr int kSpareBytes = 512 << 10;
  ::mallopt(M_TRIM_THRESHOLD, kSpareBytes);
  // Setting either threshold ends their growth with what is freed: what is large stays apart and
  // goes back at once.
  ::mallopt(M_MMAP_THRESHOLD, kSpareBytes / 2);
}

}  // namespace sable::platform::host
