#pragma once
// The concrete log writers: a file with size-based rollover, the console, syslog over a
// local datagram socket, and the in-memory ring (see CreateMemLogWriter). Each is a
// LogWriter to add to a LogOutput; each is thread-safe. Every limit has a default below.

#include <cstdint>
#include <string>

#include "pelmora/object/export.h"
#include "pelmora/service/logger.h"

namespace Pelmora::Service {

// A log file that rolls over by size. The current file is `path`; when whole lines have
// taken it to `maxFileSize` bytes or more, the next line first rolls it over: `path`.1
// becomes `path`.2 and so on, the oldest (`path`.<maxFileNum - 1>) being replaced,
// `path` becomes `path`.1 and a new `path` is opened (with maxFileNum 1 the file starts
// again empty). So at most `maxFileNum` files exist, the newest lines are in `path`, and
// a line is never split across files. Each rename is atomic, so a rolled file is always
// complete under its name. Only the rolled files there are get renamed: the highest
// index present is found when the writer is made and followed from then on, so a roll
// costs one rename per file kept, however large `maxFileNum` is. Bytes are buffered and
// written out when the buffer fills, after every line at level error or more severe, on
// Flush, and otherwise about `flushIntervalMs` after they were written (checked every
// half interval by one process-wide thread, which writes outside the lock that making
// and destroying file writers take, so a slow disk holds up only its own writer).
// While every writer of a log output is a file writer with a buffer and a flush interval
// or the in-memory ring (and one is a file writer), each thread keeps its lines of one
// level for that output, up to the smallest `threadBufferSize` among the files, and hands
// them on together: when that is full, before its next line of another level, to another
// output or one that spans pieces, with every line at level error or more severe (every
// thread's then), when the output's writers change or it is closed, and within half a
// flush interval otherwise; also on the output's Flush and Reopen, this writer's Flush
// and a read of the ring, except for an output another thread is writing a line of
// several pieces to at that moment (those never wait for it; the next half interval
// hands its batches on). So threads that log at once do not hand a lock to each other on
// every line; their lines may reach the file and the ring out of time order by up to
// one batch, a thread's own lines not (unless its turn to another output waited 100 ms
// in vain for a line of several pieces there), and a line waits up to about two flush
// intervals before it is written.
// Reopen (the manager's, after an outside rotation renamed the file) writes the buffer
// to the old file and opens `path` anew.
// When `path` cannot be opened again (after a roll or Reopen; out of descriptors, say),
// nothing is renamed until an open succeeds: the rolled files stay as they are, new lines
// are held in memory, up to `maxHeldBytes`, and later ones dropped and counted; the open
// is tried again at a line start or flush once `reopenRetryMs` have passed, and the held
// lines are written first when it succeeds.
struct PELMORA_EXPORT LogFileOptions {
   std::string path;
   std::string level = "info";
   long long maxFileSize = 10485760;  // bytes; 0 means never roll over
   int maxFileNum = 10;               // files kept, the current one included; at least 1
   int fileMode = 0644;               // of new files, before the umask
   int bufferSize = 65536;            // bytes held before a write; 0 writes every line
   int flushIntervalMs = 200;         // the longest a written line waits in the buffer
   int maxHeldBytes = 1048576;        // lines held while the file cannot be opened
   int reopenRetryMs = 1000;          // the shortest wait between two failed opens
   int threadBufferSize = 4096;       // bytes of lines a thread keeps; 0 keeps none
};
class PELMORA_EXPORT FileLogWriter : public virtual LogWriter {
public:
   // Lines dropped since the writer was made because the file could not be opened and
   // `maxHeldBytes` were held already.
   virtual uint64_t GetLostCount() const = 0;
};
// Opens (creates) the file: SystemException when that fails.
PELMORA_EXPORT void CreateFileLogWriter(const std::string& name, const LogFileOptions& options,
                         Ref<LogWriter>& out);
PELMORA_EXPORT void CreateFileLogWriter(const std::string& name, const LogFileOptions& options,
                         Ref<FileLogWriter>& out);

// Writes each line to standard error (or standard output) at once.
PELMORA_EXPORT void CreateConsoleLogWriter(const std::string& name, const std::string& level, bool toStdout,
                            Ref<LogWriter>& out);

// Sends each line as one datagram in the local syslog format
// "<priority>Mmm dd hh:mm:ss ident[pid]: line" to a local datagram socket. The socket
// need not exist: a line that cannot be sent for want of a socket is dropped and counted,
// and the writer connects again on the next line (at most once per
// `reconnectIntervalMs`). A full socket (the receiver is behind) is waited for, up to
// `sendTimeoutMs` per line and `sendWaitBudgetMs` for all lines within any one second;
// then the line is dropped and counted. A line that waited its whole `sendTimeoutMs` in
// vain marks the receiver as stopped: later lines are not waited for until one gets
// through, so a receiver that never reads costs one `sendTimeoutMs`.
// A line longer than `maxMessageSize` bytes (the line, without the syslog header and
// the newline) is cut to fit at a UTF-8 character boundary. Priorities: quiet -> notice,
// panic -> crit, error -> err, warning -> warning, info -> info, verbose and trivia ->
// debug; with the facility.
struct PELMORA_EXPORT LogSyslogOptions {
   std::string socketPath = "/dev/log";
   std::string ident;               // empty: the program's name
   std::string level = "info";
   int facility = 3 << 3;           // daemon
   int maxMessageSize = 8192;       // bytes of a line kept; at least 64
   int reconnectIntervalMs = 1000;
   int sendTimeoutMs = 100;         // the longest one line waits for a full socket
   int sendWaitBudgetMs = 500;      // the longest all lines wait within one second
   int keepBufferBytes = 16384;     // capacity kept between lines; more is released
};
class PELMORA_EXPORT SyslogLogWriter : public virtual LogWriter {
public:
   // Lines dropped since the writer was made (no socket, or the receiver stayed full).
   virtual uint64_t GetLostCount() const = 0;
   // Lines cut to maxMessageSize.
   virtual uint64_t GetTruncatedCount() const = 0;
};
PELMORA_EXPORT void CreateSyslogLogWriter(const std::string& name, const LogSyslogOptions& options,
                           Ref<SyslogLogWriter>& out);

// The priority (facility excluded) that syslog lines of a level get.
PELMORA_EXPORT int GetSyslogSeverity(Logger::LogLevel level);

}  // namespace Pelmora::Service
