#pragma once

#include <iosfwd>
#include <string>

/// What `stick make` is to write, and where.
struct MakeOptions
{
    std::string archive; ///< becomes OSUpgrade.zip
    std::string script;  ///< becomes unzipUpgrade.sh
    std::string version; ///< as the board will report it
    std::string target;  ///< the folder that the stick is mounted at, or any folder
    std::string key;     ///< signs the stick, as gpg(1) takes it; empty: not signed
    std::string oldest;  ///< the oldest version that this one may replace; empty: any
    bool teamViewer = false;
    bool replace = false;  ///< the version folder that is there may go
    bool progress = false; ///< on `errors`, for a terminal
};

/// Writes a stick, reads it back from the medium, compares it, and prints what `stick` says of it to `out`.
///
/// Until the last byte is compared the version folder has a hidden name, which is no version to the updater and not fit
/// to `stick`. What else is on the stick stays; when the writing fails, so does the version that was there.
///
/// @return a Report::Status; STATUS_NOT_FIT also for what the updater could not use, STATUS_UNCHECKED, with a message
///         on `errors`, when the stick could not be written
int makeStick(const MakeOptions& options, std::ostream& out, std::ostream& errors);
