// Where the lines of a log come from.
#ifndef PELORUS_DOCTOR_LOG_SOURCE_H
#define PELORUS_DOCTOR_LOG_SOURCE_H

#include <zlib.h>

#include <functional>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "common/handles.h"
#include "doctor/evidence.h"

namespace pelorus::doctor {

/// Cuts a stream into lines and passes on those that mention the daemon. Lines that begin with a
/// blank continue the one before, as the journal shows them. A line longer than 8 KiB is cut there.
class LineFilter {
public:
    using Taker = std::function<void(std::string_view line)>;

    explicit LineFilter(Taker lineTaker) : taker{std::move(lineTaker)} {}

    /// The next piece of the stream, of any length.
    void take(std::string_view piece);

    /// The end of the stream: the last line may lack its newline.
    void finish();

private:
    void takeWholeLines(std::string_view lines);
    [[nodiscard]] std::size_t takeContinuation(std::string_view lines);
    void endOpenLine();
    void pass();

    Taker taker;
    std::string held;  // a line that the next one may continue
    std::string open;  // the beginning of a line that has not ended yet
};

/// A file, a pipe or standard input, plain or compressed by gzip.
class LogStream {
public:
    /// Opens @p path for reading, standard input for "-"; regular files only, and pipes when
    /// @p orPipe. Not open when that fails; `problem` then says why.
    LogStream(const std::string& path, bool orPipe);

    /// Takes over an open descriptor.
    explicit LogStream(int descriptor);

    [[nodiscard]] bool isOpen() const { return file != nullptr; }
    [[nodiscard]] bool isPipe() const { return pipe; }  ///< it cannot be read twice

    /// The first stamp of any program's lines among the first 64 KiB, which are read again later.
    /// Ignores stamps before a jump ahead of months: the clock was not set yet.
    std::optional<Time> firstStamp(Time now);

    /// The last stamp of any program's lines, once all was read.
    [[nodiscard]] std::optional<Time> lastStamp(Time now) const;

    /// Reads to the end. False, and `problem` set, when it cannot be read to its end; what came
    /// before has been passed on.
    bool read(const LineFilter::Taker& taker);

    std::string problem;  ///< in a few words; empty if there is none

private:
    std::unique_ptr<gzFile_s, Releaser<gzclose>> file;
    std::string head;  // read by firstStamp()
    std::string tail;  // the last lines
    bool pipe = false;
};

/// A log's name, taken apart.
struct RotatedName {
    std::string log;  ///< without the number
    int number{};     ///< the higher, the older; 0 for the newest one
};

/// Takes apart the name of a log in @p path: "/x/syslog.2.gz" is number 2 of "/x/syslog".
RotatedName rotationOf(const std::string& path);

/// The files in which system loggers of Debian and its relatives keep @p name under @p folder, with
/// the rotated ones (numbered or dated), oldest first.
std::vector<std::string> rotatedLogs(const std::string& folder, const std::string& name);

}  // namespace pelorus::doctor

#endif
