# Included by CTest after the discovered cases: the long ones by name, so
# that a run with no timings of its own yet (a fresh clone) starts them
# before the short ones and the parallel lanes end close together. The
# figures are seconds on a loaded 2-core machine; only their order matters.
set(s2s_long_cases
    "ToolsTest.CancelledTransferResumesDeletionsAreGuardedAFullDiskIsNamed" 20
    "ToolsTest.SyncsFailuresDryRunAndOperatorCommandsOnOneServer" 16
    "ServiceTest.RunsSendOnlyNeededCommandsCancelCleanlyAndPairAgain" 16
    "ServiceTest.ScheduledRunsByThemselvesApartAndCatchUpOnceManualWaits" 14
    "ServerDaemonTest.SyncRunGuardedAgainstHostileClients" 10
    "ToolsTest.KilledClientLeavesNoRsyncRunningAndNoCommandFiles" 10
    "RsyncerKeyTest.KeyFilesTravelOverSshEvenWithSshOff" 8
    "ServiceControlTest.BadRequestsChangeNothingAndCtlRunsATaskEndToEnd" 5)
while(s2s_long_cases)
  list(POP_FRONT s2s_long_cases name cost)
  set_tests_properties("${name}" PROPERTIES COST ${cost})
endwhile()
