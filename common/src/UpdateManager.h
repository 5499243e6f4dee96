#pragma once

#include <cstdint>
#include <string>
#include <thread>
#include <vector>

/// The update engine of both heads: runs shell commands, judges their exit codes and output, and reports every outcome
/// through three callbacks.
///
/// Set the callbacks, then call init(), update() and deinit() once each, in this order. For the remote head each runs
/// on the caller's thread; for the main head each runs on a worker thread and returns at once.
class UpdateManager
{
public:
    enum Result : std::int32_t {
        RESULT_NO_UPDATE = 0, ///< Nothing was installed; on the remote head also when the board could not be checked.
        RESULT_UPDATED = 1,   ///< Everything that had to be installed was.
    };

    enum Error : std::int32_t {
        ERROR_CHECK_UPDATE = 0,       ///< The versions, or whether TeamViewer is wanted, could not be established.
        ERROR_UPDATE_MIRRORS = 1,     ///< The mirror refresh failed.
        ERROR_INSTALL_PACKAGE = 2,    ///< The head's package could not be installed.
        ERROR_INSTALL_QUORB = 3,      ///< The Quorb board's files could not be uploaded.
        ERROR_INSTALL_TEAMVIEWER = 4, ///< TeamViewer could not be installed; main head only.
    };

    enum ComponentKind : std::int32_t {
        COMPONENT_PACKAGE = 0,
        COMPONENT_QUORB = 1,
        COMPONENT_TEAMVIEWER = 2,
    };

    /// A component that has an update.
    struct UpdateComponent
    {
        std::int32_t kind = COMPONENT_PACKAGE; ///< A ComponentKind; other values are passed over by the installation.
        std::string name;                      ///< Display label.
        std::string installedVersion;
        std::string candidateVersion;
    };

    using ResultCallback = void (*)(Result);
    using ErrorCallback = void (*)(Error);
    using UpdateFoundCallback = void (*)(std::vector<UpdateComponent>);

    /// The one engine of the process, created by the first call and never destroyed.
    static UpdateManager* instance();

    /// @name One update
    /// @{

    /// Stores the callbacks, unchecked. They are called on the thread that runs the head's procedure.
    void setCallbacks(ResultCallback resultCallback, ErrorCallback errorCallback,
                      UpdateFoundCallback updateFoundCallback);

    /// True when none of the three callbacks is null.
    bool validateCallbacks();

    /// Opening step of the remote head (`head` true) or the main head (false). Aborts when a callback is missing.
    void init(bool head);

    /// The update itself. Aborts when a callback is missing.
    ///
    /// For the remote head (`head` true) `components` is ignored. For the main head it is the list to install, as
    /// offered to the update-found callback; the call first waits for the check that init(false) started.
    void update(std::vector<UpdateComponent> components, bool head);

    /// Closing step of the remote head (`head` true) or the main head (false). Aborts when a callback is missing.
    ///
    /// For the main head it does not wait for an installation that is still running.
    void deinit(bool head);

    /// @}
    /// @name Remote-head procedure
    /// @{

    /// Stops the instrument application.
    static void initRemoteHead();

    /// Brings the head's package and the Quorb board up to date and reports one result or error. Removes the
    /// first-boot marker once both are there and something was installed.
    static void updateRemoteHead();

    /// Leaves the outcome on the panel for 30 s, then gives the instrument back with startHARL().
    static void deinitRemoteHead();

    /// @}
    /// @name Main-head procedure
    /// @{

    /// Stops the application, checks all components and reports one list of updates, result or error. Installs nothing,
    /// but removes the first-boot marker once the checks are through.
    static void initMainHead();

    /// Installs `components` in their order and reports one result or error. An empty list counts as updated.
    static void updateMainHead(std::vector<UpdateComponent> components);

    /// Gives the instrument back with startHARL(), without a pause.
    static void deinitMainHead();

    /// @}
    /// @name Checks and installations
    /// @{

    /// Refreshes the package manager's index. True when the refresh exited with 0.
    static bool updateMirrors();

    /// Compares the installed and the candidate version that a package policy query prints.
    ///
    /// @param ignoreNoInternet  false: a query that exits with 100 is taken for a missing connection and ends the check
    /// @param command           the complete query command line
    /// @param installed         out: the installed version, empty when not found
    /// @param candidate         out: the candidate version, empty when not found
    /// @param versionsFound     out: true when both versions were found
    /// @return true when both were found and differ; there is no version ordering
    static bool checkUpdate(bool ignoreNoInternet, const std::string& command, std::string& installed,
                            std::string& candidate, bool& versionsFound);

    /// Runs the complete install command line. True when it exited with 0, and also when it could not be started.
    static bool installUpdate(const std::string& command);

    /// Compares the version that the Quorb board runs with the one that the USB stick carries.
    ///
    /// @param installed      out: the version on the board, empty when it could not be read
    /// @param candidate      out: the version on the stick, empty when not found
    /// @param versionsFound  out: true when both versions were found
    /// @return true when both were found and differ; there is no version ordering
    static bool checkQuorbUpdate(std::string& installed, std::string& candidate, bool& versionsFound);

    /// Copies the upgrade archive and the install script from the stick to the board, in up to 20 attempts. True when
    /// one of them copied both.
    static bool uploadQuorbFiles();

    /// Uploads the board's files, runs the install script there and waits 13 minutes for the board.
    ///
    /// @return true when the files reached the board; the script's own status is only logged
    static bool installQuorbUpdate();

    /// Placeholder for a check of the board after its installation; always true. Part of the engine's interface for
    /// both heads' programs; neither procedure calls it.
    bool verifyQuorb();

    /// Looks for the marker on the stick that requests a TeamViewer installation.
    ///
    /// @param ok  out: false only when the test itself failed, so that the answer cannot be trusted
    /// @return true when TeamViewer must be installed
    static bool checkTVUpdate(bool& ok);

    /// Runs the TeamViewer install script of the unit. Always true: the script's status is only logged.
    static bool installTVUpdate();

    /// @}
    /// @name Services
    /// @{

    /// Stops the instrument application.
    static void stopHARL();

    /// Releases the stick, starts the application, gives it 10 s, then stops the updater's own service.
    static void startHARL();

    /// Stops the updater's own service; run as that service, the process ends here.
    static void stopUpdater();

    /// @}
    /// @name Commands
    /// @{

    /// Runs a complete shell command line and collects its standard output. Standard error is left alone.
    ///
    /// @param command  the command line for popen(3)
    /// @param output   out: what the command printed, unchanged, but for what follows a NUL byte in a line
    /// @return the exit code; 0 as well when a signal ended the command, when it could not be started (`output` is then
    ///         empty) or when its status could not be had
    static std::int32_t runProcess(const std::string& command, std::string& output);

    /// @}

    UpdateManager(const UpdateManager&) = delete;
    UpdateManager& operator=(const UpdateManager&) = delete;

private:
    UpdateManager() = default;

    std::thread* mWorkerThread = nullptr;
    ResultCallback mResultCallback = nullptr;
    ErrorCallback mErrorCallback = nullptr;
    UpdateFoundCallback mUpdateFoundCallback = nullptr;
};
