#pragma once

namespace sable::platform::host {

/// Sets the C library's allocator up for a process with few threads that mostly waits: one heap for
/// all of them, whose end is given back only when it is large. Call it before the first thread
/// starts.
void shareOneHeap();

/// Gives back the pages of programs and libraries that linking and starting have touched, 4 MiB of which
/// are not needed again: symbol tables, constructors. They stay in the page cache, from where a
/// touch maps them again, but they are no longer held for this process. Call it once, when all is started. A
/// debugger's breakpoints that were set before go with the pages.
void releaseStartUpPages();

}  // namespace sable::platform::host
