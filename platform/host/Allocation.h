#pragma once

namespace sable::platform::host {

/// Sets the C library's allocator up for a process with few threads that mostly waits: one heap for
/// all of them, whose end is given back only when it is large. Call it before the first thread
/// starts.
void shareOneHeap();

/// Gives back the pages of the program and its libraries that linking and starting have touched, symbol
/// tables and constructors, 4 MiB that are hardly needed again. They stay in the page cache, from where a
/// touch maps them again. Call it once, when all is started; a debugger's breakpoints of before are lost.
void releaseStartUpPages();

}  // namespace sable::platform::host
