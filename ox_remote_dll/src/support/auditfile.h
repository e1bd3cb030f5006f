// The program's one kind of log file.
#pragma once

#include <atomic>
#include <cstdarg>
#include <cstdio>
#include <string>
#include <string_view>

#include "platform/mutex.h"

// A text file written line by line under one process-wide lock, each line stamped with the local time, with a numeric
// debug level that filters lines. Level 0 silences the object altogether.
//
// Thread rules: any thread may write; lines of different threads and different objects never interleave. `Open`,
// `Close`, `Attach` and assignment may be called while others write. The lock is plain: `Stamp` is called with it held
// and must not log. A line that the level filters costs neither the lock nor the formatting.
//
// Errors: a file that cannot be opened is reported on standard error and everything written later is dropped. Nothing
// throws.
class oxAuditFile {
public:
    // A formatted text is cut at this length.
    static constexpr std::size_t MAX_TEXT = 4095;
    static constexpr std::size_t MAX_PATH_TEXT = 4094;
    static constexpr std::size_t MAX_STAMP_TEXT = 127;
    // Tries to open a file without a stream to fall back on, one second apart.
    static constexpr int OPEN_TRIES = 3;

    oxAuditFile();
    // Opens at once.
    oxAuditFile(const char* name, const char* mode);
    oxAuditFile(const oxAuditFile& other);
    virtual ~oxAuditFile();

    // Opens for one of the modes of fopen, closing what is open first. A name without "/" is taken in the default
    // directory. With a stream (standard error, for the process's own log) that stream itself, and its descriptor, now
    // write to the file; where that fails the stream stays as it was. False with errno.
    virtual bool Open(const char* name, const char* mode, std::FILE* stream = nullptr);
    // Flushes, closes the stream unless it is standard error, and forgets the echo.
    virtual void Close();
    // One line, when the level admits it. A text that ends with a newline gets no second one in the file, but one more
    // on the echo.
    virtual void Write(const char* text, int msgLevel);
    // One line whatever its level, unless the object's level is 0.
    virtual void Printf(const char* format, ...) __attribute__((format(printf, 2, 3)));
    // One line when the level is at most the object's.
    virtual void Printf(int msgLevel, const char* format, ...) __attribute__((format(printf, 3, 4)));
    // Reports a failure of the file itself on standard error.
    virtual void Error(int errnum);
    // Makes the time stamp of a line. Called with the lock held.
    virtual const char* Stamp();
    // A log on standard error does not count as open.
    virtual bool IsOpen();
    // Closes what is open, then shares the other's streams; the other goes on owning them, and must outlive the use of
    // the copy.
    virtual oxAuditFile& operator=(const oxAuditFile& other);
    // Closes what is open, then writes to the given stream.
    virtual void Attach(std::FILE* stream);

    void SetDebugLevel(int level);
    int GetDebugLevel() const { return m_level; }
    void SetEcho(std::FILE* echo);
    std::FILE* GetStream() const { return m_stream; }
    const char* GetPath() const { return m_path; }

    static void SetDefaultPath(const char* directory);
    static const char* GetDefaultPath() { return m_defPath; }
    static void SetDefaultDebugLevel(int level) { m_defDebugLevel = level; }
    static int GetDefaultDebugLevel() { return m_defDebugLevel; }
    // Not owned; must live as long as anything may log.
    static void SetDefaultAudit(oxAuditFile* audit) { m_pDefaultAudit = audit; }
    static oxAuditFile* GetDefaultAudit() { return m_pDefaultAudit; }

    // For the out-of-memory and terminate handlers: the line goes out with the stamp and without allocating, and is
    // given up when the lock stays taken for a moment (the failing thread may hold it itself).
    void WriteFromHandler(std::string_view text) noexcept;

protected:
    void VPrintf(const char* format, va_list arguments) __attribute__((format(printf, 2, 0)));
    void VPrintf(int msgLevel, const char* format, va_list arguments) __attribute__((format(printf, 3, 0)));

private:
    bool Admits(int msgLevel) const;
    void FormatLine(const char* format, va_list arguments) __attribute__((format(printf, 2, 0)));
    void WriteLine(std::string_view text);
    void CopyFrom(const oxAuditFile& other);
    bool Store(std::FILE* stream, const std::string& path);

    char m_path[MAX_PATH_TEXT + 1] = {};
    char m_stamp[MAX_STAMP_TEXT + 1] = {};
    std::FILE* m_stream = nullptr;
    std::FILE* m_echo = nullptr;
    std::atomic<int> m_level;
    int m_echoLevel = 7;    // nothing reads it
    bool m_shared = false;  // the streams belong to the object that this one was copied from

    static char m_defPath[MAX_PATH_TEXT + 1];
    static int m_defDebugLevel;
    static oxAuditFile* m_pDefaultAudit;
    // Never destroyed: threads and static objects may log until the process is gone.
    static MMutex& m_wrLock;
};
