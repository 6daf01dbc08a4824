#include "platform/host/Allocation.h"

#include <link.h>
#include <malloc.h>
#include <sys/mman.h>
#include <unistd.h>

#include <cstddef>
#include <cstdint>

namespace sable::platform::host {

namespace {

int releaseUnwritten(dl_phdr_info* object, std::size_t, void*) {
  const auto page = static_cast<std::uintptr_t>(::sysconf(_SC_PAGESIZE));
  for (std::size_t i = 0; i < object->dlpi_phnum; ++i) {
    const auto& segment = object->dlpi_phdr[i];
    // What may be written holds what relocation wrote, even where it is read-only by now.
    if (segment.p_type != PT_LOAD || (segment.p_flags & PF_W) != 0) continue;
    const std::uintptr_t begin = object->dlpi_addr + segment.p_vaddr;
    const std::uintptr_t firstPage = begin & ~(page - 1);
    auto* const start = reinterpret_cast<void*>(firstPage);  // NOLINT(*-int-to-ptr): the linker tells numbers
    // Where the kernel refuses, as for its own object, the pages just stay.
    ::madvise(start, begin + segment.p_memsz - firstPage, MADV_DONTNEED);
  }
  return 0;
}

}  // namespace

void releaseStartUpPages() {
  ::dl_iterate_phdr(releaseUnwritten, nullptr);
}

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
