#pragma once

namespace sable::platform::host {

/// Sets the C library's allocator up for a process with few threads that mostly waits: one heap for
/// all of them, whose end is given back only when it is large. Call it before the first thread
/// starts.
void shareOneHeap();

}  // namespace sable::platform::host
