#pragma once

#include "texts.h"

#include <cstddef>
#include <cstdint>
#include <optional>
#include <string_view>

/// What the updater does in one run, in its order.
enum class StepKind {
    START,
    STOP_APPLICATION,
    REFRESH_MIRRORS,
    CHECK_PACKAGE,
    INSTALL_PACKAGE,
    CHECK_BOARD,
    UPLOAD_BOARD,
    RUN_BOARD_SCRIPT,
    WAIT_FOR_BOARD,
    CHECK_TEAMVIEWER,   // main head only
    INSTALL_TEAMVIEWER, // main head only
    REMOVE_MARKER,
    SHOW_OUTCOME,
    SHOW_TO_OPERATOR,
    GIVE_BACK,
    STOP_UPDATER,
};
const std::size_t stepKinds = static_cast<std::size_t>(StepKind::STOP_UPDATER) + 1;

/// What is known of a step before it runs.
struct StepFacts
{
    const char* name;       ///< for programs, such as "refresh-mirrors"
    const char* title;      ///< for people, such as "Refresh the package mirrors"
    std::int64_t wait;      ///< s that it always takes; 0 when that depends
    std::int64_t longest;   ///< s; a step that takes longer has most likely died
    const char* afterwards; ///< what to do when the run ended in it
};

const StepFacts& factsOf(StepKind kind);

/// What a record of the updater says.
enum class Event {
    NONE,  ///< Nothing that matters here, or not the updater's words.
    NOTED, ///< It belongs to its step and says nothing more.
    VERSION,
    RUN_BEGINS,
    ENDED_BY_ITSELF,
    MAIN_CHECKS,   ///< the main head's program begins its checks
    MAIN_INSTALLS, ///< likewise the installation of a part
    MAIN_FINISHED,
    COMMAND, ///< a command line; its exit code follows
    EXIT_CODE,
    ATTEMPT, ///< a command line that the updater tries several times
    ATTEMPT_FAILED,
    RAW_STATUS, ///< of the command that the step runs
    SUCCEEDED,
    FAILED,
    VERSIONS_DIFFER, ///< of the package or of the board, as the step tells
    VERSIONS_SAME,
    BOARD_VERSIONS,
    BOARD_NOT_READ,
    STICK_NOT_READ,
    TEAMVIEWER_REQUESTED,
    TEAMVIEWER_NOT_REQUESTED,
    MIRRORS_REPORTED, ///< ERROR_UPDATE_MIRRORS comes next
    CHECK_REPORTED,   ///< ERROR_CHECK_UPDATE
    PACKAGE_REPORTED, ///< ERROR_INSTALL_PACKAGE
    BOARD_REPORTED,   ///< ERROR_INSTALL_QUORB
    MARKER_REMOVED,
    RESULT,
    ERROR,
    OUTCOME_SHOWN,
    STOPS_UPDATER,
    SOUND_FAILED,
    PANEL_FAILED,
};

/// A record's event and what its message holds besides.
struct Meaning
{
    Event event = Event::NONE;
    std::optional<StepKind> step; ///< the one that the record belongs to
    const char* command = "";     ///< that begins with the record, where the message does not name it
    std::string_view rest;        ///< of the message, after the words that are always the same
    std::optional<long> number;   ///< at the start of `rest`
};

/// The meaning of a record.
///
/// @param message  empty optional: it is not in the log
Meaning meaningOf(std::string_view operation, std::optional<std::string_view> message);

/// What a line of the service around the updater says (see service/).
enum class ServiceEvent {
    NONE,   ///< Nothing that matters here.
    REPAIR, ///< before the run
    REPAIRED,
    REPAIR_FAILED,
    NOT_ALLOWED, ///< The updater is not run.
    TIME_USED_UP,
    FAILURE_SHOWN, ///< the updater having ended without an outcome
    SHOWN_AGAIN,
    PANEL_REFUSED,
    STICK_IN_USE,
    WENT_ON, ///< beside a tool that is still at work
    NOT_STARTED,
    UNIT_WELL,
    UNIT_NOT_WELL,
    UNIT_OPEN,
};
const std::size_t serviceEvents = static_cast<std::size_t>(ServiceEvent::UNIT_OPEN) + 1;

/// Empty when the line is not one of the service's.
std::optional<ServiceEvent> serviceEventOf(std::string_view line);

/// True when `message` is one that `operation` writes and that says something.
///
/// @param output  also when it can be a line of a command's output, which some operations log
bool isMessageOf(std::string_view operation, std::string_view message, bool output);
