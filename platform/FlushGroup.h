// Directory flushes shared between concurrent callers. Creators that each
// renamed an entry into the same directory need that directory flushed before
// they may answer; one fsync started after every one of their renames covers
// them all. A caller whose change came after the running flush began waits for
// the next one, which one of the waiters runs.
#pragma once

namespace platform {

// fsync of the directory open as fd, or of the same directory (device and
// inode) by another caller, started after this call began. 0 or an errno
// value; a failure is reported to every caller the failed flush covered.
int flushDirectoryShared(int fd);

}  // namespace platform
