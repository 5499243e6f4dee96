#pragma once

#include <cstddef>
#include <cstdint>
#include <vector>

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
