// Every limit of the service, each with its reason and, in brackets, with the tests that
// show it. `scripts/limits` writes docs/limits.md from it. Limits live in the bindings;
// the core knows none.
#pragma once

#include <chrono>
#include <cstddef>
#include <cstdint>

namespace ostrel::limits {

// What one request may be

/// Of one frame, its length field left out. Payloads of 256 KiB must fit with
/// their request around them.
/// [UnixSocketListener.TakesAFrameOfTheLargestSizeAndNoneLarger]
inline constexpr std::size_t kFrameBytes = 320 * 1024;

/// Arrays and dictionaries within one another in a payload. Deeper ones are no
/// reports; walks stay short.
/// [PayloadCheck.TakesNestingUpToTheLimit,
/// ListenerRequests.AreTakenUpToTheirLimit]
inline constexpr std::size_t kNesting = 32;

/// Values in one payload, keys included: bounds the work that one frame causes.
/// [PayloadCheck.TakesValuesUpToTheLimit,
/// ListenerRequests.AreTakenUpToTheirLimit]
inline constexpr std::size_t kNodes = 65536;

/// Of one text key.
/// [PayloadCheck.TakesKeysUpToTheLimit,
/// ListenerRequests.AreTakenUpToTheirLimit]
inline constexpr std::size_t kKeyBytes = 1024;

/// IDs in one request: each is one delivery.
/// [RequestFrame.TakesIDsUpToTheLimit,
/// ListenerRequests.AreTakenUpToTheirLimit]
inline constexpr std::size_t kReporterIDs = 1024;

// What the clients of a user may have and have under way

/// Connections in all, and of one user. Room for 512 and for load tests of
/// 1,000 by one user.
/// [UnixSocketListener.ServesAsManyConnectionsAsAllowedAndSaysWhyNoMore]
inline constexpr std::size_t kConnections = 2048;
inline constexpr std::size_t kConnectionsOfUser = 1536;

/// Bytes of one connection's requests that are accepted and not yet carried out,
/// delivered and stored. Beyond it the socket is not read until half of it is free
/// again. Some 10,000 messages of usual size: the store's next commit always finds
/// enough to write.
/// [RequestBudget.IsExceededBeyondItsBytes,
/// UnixSocketListener.HoldsBackAClientWithTooMuchUnderWayAndLosesNothing]
inline constexpr std::size_t kQueuedBytes = 4 * 1024 * 1024;

/// The same of all connections of one user, so that many connections do not make
/// many times the memory.
/// [RequestBudget.IsExceededBeyondItsBytes,
/// PeerChannelBudget.IsThatOfAllConnectionsOfTheUserToo,
/// ListenerSharesUnderWay.AreThoseOfAllConnectionsOfTheUser]
inline constexpr std::size_t kQueuedBytesOfUser = 12 * 1024 * 1024;

/// What a connection may have of that when the user's other connections have it all: a
/// client with a request or two is served however much the others sent.
/// [UnixSocketListener.ServesAClientWithLittleUnderWayHoweverMuchItsUserHas]
inline constexpr std::size_t kReservedQueuedBytes = 2 * 1024;

/// That of all the user's processes together. Each that has any has its part of it, and
/// its connections have that among them, `kMostReservedBytes` at most each. A client with
/// some requests a moment is served while others have all that they may, however many
/// connections they have.
/// [PeerChannelReserve.IsMoreWhereProcessesAreFew,
/// PeerChannelReserve.IsNoMoreForAProcessWithManyConnections]
inline constexpr std::size_t kReservedQueuedBytesOfUser = 8 * 1024 * 1024;
inline constexpr std::size_t kMostReservedBytes = 256 * 1024;

/// Bytes of frames that are not whole yet, of all connections of one user: some 25 of
/// the largest. Beyond it the connection that is in one longest is cut off.
/// [UnixSocketListener.CutsOffWhoIsLongestInAFrameWhereAUserHasTooManyHalves]
inline constexpr std::size_t kHalfFrameBytesOfUser = 8 * 1024 * 1024;

/// Sessions in all, and of one user. Room for the 16,384 that are promised and for
/// load tests of 100,000 by one user; an idle session costs some 500 bytes.
/// [UserAccount.TakesSessionsUpToTheUsersShareAndTheServices,
/// UnixSocketListener.MakesAsManySessionsAsAllowedAndAnswersYesForOneMore]
inline constexpr std::size_t kSessions = 256 * 1024;
inline constexpr std::size_t kSessionsOfUser = 100 * 1024;

/// Sessions that a user may have however much else its clients have in memory, and how
/// much that is from which on it may have no more. Whoever has many sessions does not
/// have many requests that nobody carries out.
/// [UserAccount.TakesFewerSessionsWhereThereIsMuchElse]
inline constexpr std::size_t kSessionsInNeed = 16 * 1024;
inline constexpr std::size_t kMemoryBytesBesideSessions = 8 * 1024 * 1024;

/// What one of them is taken to need in memory as long as it is idle.
/// [CrowdedUser.HasMoreThanItsMemory]
inline constexpr std::size_t kSessionBytes = 512;

/// What all that one user's clients have in memory may be: requests under way, replies
/// and halves of frames, user infos, sessions. Beyond it there is only a part of each
/// share, an eighth or, of requests, a quarter and, of frames, a half; so that the
/// service stays within 96 MiB though the shares are more together.
/// [CrowdedUser.HasMoreThanItsMemory,
/// CrowdedUser.HasPartOfEachShare,
/// ListenerShares.OfACrowdedUserAreLessForUserInfos,
/// ListenerShares.OfACrowdedUserAreLessForHalvesOfFrames,
/// ListenerSharesUnderWay.AreAQuarterForACrowdedUser]
inline constexpr std::size_t kMemoryBytesOfUser = 16 * 1024 * 1024;

/// The same of all users together, of each kind and of all kinds. Some users may each
/// have their shares side by side; when that becomes too much, each has a part of the
/// total at most, which is more than clients that behave have. Of all kinds little more
/// than what one user may have: the service is no larger beside many users that ask for
/// too much than beside one.
/// [MemoryOfUsers.IsSharedOutBeyondTheTotalOfEachKind,
/// MemoryOfUsers.LeavesOneWithLittleItsReserve,
/// ListenerOfUsers.HoldsBackWhoHasMuchOfWhatIsUnderWay,
/// ListenerOfUsers.CutsOffHalvesOfFramesOfWhoHasMany]
inline constexpr std::size_t kQueuedBytesOfAll = 32 * 1024 * 1024;
inline constexpr std::size_t kUnreadReplyBytesOfAll = 16 * 1024 * 1024;
inline constexpr std::size_t kHalfFrameBytesOfAll = 16 * 1024 * 1024;
inline constexpr std::size_t kUserInfoBytesOfAll = 24 * 1024 * 1024;
inline constexpr std::size_t kMemoryBytesOfAll = 24 * 1024 * 1024;

/// Parts of those totals, and of those of sessions and of bytes kept for summaries, one
/// of which each user has in any case.
/// [MemoryOfUsers.LeavesOneWithLittleItsReserve,
/// UserAccount.HasItsPartOfTheServicesShareWhateverTheOthersHave]
inline constexpr std::size_t kUsersInReserve = 16;

/// Bytes of the entries that sessions keep for their summaries, in all, and of the
/// messages of one user's clients. Room for a session of a million messages. They lie in
/// a file, but the summary is made in memory, and there it takes four times as much where
/// the messages are large: so it stays below the 1 GiB that the unit gives the service.
/// [UserAccount.KeepsBytesUpToTheUsersShareAndTheServices,
/// ListenerShares.OfAUserAreTheBytesThatItsSessionsKeep,
/// PressedService.StopsASessionThatHasKeptMuch]
inline constexpr std::size_t kKeptBytes = 240 * 1024 * 1024;
inline constexpr std::size_t kKeptBytesOfUser = 240 * 1024 * 1024;

/// What a request costs on a queue beside its payload: the step, its place in the
/// queue, the buffer's head.
/// [UnixSocketListener.HoldsBackAClientThatFloodsRequestsWithoutPayload]
inline constexpr std::size_t kRequestBytes = 256;

/// What each delivery of a message costs beyond the first, with the size of the request:
/// its step on the queue of the session and its place in the store's; and what the
/// session's list and the store write of it, which others' messages wait for. A message
/// to all is taken to go to every session that there is, `kReporterIDs` at most.
/// [UnixSocketListener.ChargesEachDeliveryOfAMessage]
inline constexpr std::size_t kDeliveryBytes = 512;

/// What a request costs besides that starts a session, until the start is over and what
/// it put into the store's queue is written: the client may have gone meanwhile.
/// [RequestBurden.OfAStartLastsUntilItsLastStepHasRun]
inline constexpr std::size_t kStartBytes = 4096;

/// What one costs besides that stops or destroys a session or changes its type, until its
/// last step on the session's queue has run, and the store's likewise.
/// [RequestBurden.OfAStopLastsUntilItsLastStepHasRun]
inline constexpr std::size_t kSessionStepBytes = 512;

/// What a request that wants a reply costs besides: the callback, and the reply
/// that it causes. Keeps the replies to what is queued below `kUnreadReplyBytes`.
/// [UnixSocketListener.CutsOffAClientThatNeverReadsItsReplies]
inline constexpr std::size_t kReplyBytes = 256;

// Turns

/// Work that a client's turn may take, in nanoseconds of an estimate: then the requests
/// that it brought are served, and others have theirs. Some hundred messages of usual
/// size, so that a turn costs no more than it did when it had no end.
/// [PeerConnectionTurn.EndsWhenItsWorkIsDone]
inline constexpr std::uint64_t kTurnWork = 500'000;

/// How long turns are taken before the sockets are looked at again: whoever was quiet
/// then goes before the rest of the line.
/// [ListenerTurnsBetweenLooks.EndAfterAWhileWithSomeStillInLine]
inline constexpr std::chrono::microseconds kTurnsBetweenLooks{250};

// What sessions are told of themselves

/// Of one session's user info, which configurations add to and nothing takes from. An
/// entry beyond it is left out. A few dozen entries are usual, of a kilobyte or two.
/// [UserInfo.TakesBytesUpToTheLimit,
/// ListenerShares.OfAUserInfoAreItsBytes]
inline constexpr std::size_t kUserInfoBytes = 64 * 1024;

/// Its entries: each configuration looks at all of them.
/// [UserInfo.TakesEntriesUpToTheLimit,
/// ListenerShares.OfAUserInfoAreItsEntries]
inline constexpr std::size_t kUserInfoEntries = 512;

/// The bytes of all that one user's clients gave, the copies that live telemetry sessions
/// have among them: a kilobyte for each of 16,384 sessions.
/// [UserInfo.OfAllSessionsOfAUserTakesBytesUpToTheLimit,
/// ListenerShares.OfAUserAreTheUserInfosOfAllItsSessions]
inline constexpr std::size_t kUserInfoBytesOfUser = 16 * 1024 * 1024;

// Replies

/// Reply bytes that a client has not read. Beyond it the client is cut off. A reply
/// that is larger alone is sent all the same.
/// [PeerChannelReplies.StayUnreadUpToTheLimit,
/// ListenerUnreadReplies.OfAClientAreTakenUpToItsLimit]
inline constexpr std::size_t kUnreadReplyBytes = 1024 * 1024;

/// Reply bytes from which on no further requests are read; a client that is merely
/// slow stays below `kUnreadReplyBytes` by it.
/// [UnixSocketListener.SendsALargeReplyToAClientThatReadsSlowly]
inline constexpr std::size_t kUnreadReplyBytesToPause = kUnreadReplyBytes / 4;

/// What all connections of one user have unread: enough for the largest reply on some of
/// them. Beyond it each may have `kUnreadReplyBytesInNeed`, so that many connections
/// do not make many times the memory.
/// [UnreadReplies.OfOthersLeaveAClientItsRoomUpToTheLimitOfTheirUser,
/// ListenerUnreadRepliesAround.ThatOfTheUserLeaveAClientLittleBeyondIt]
inline constexpr std::size_t kUnreadReplyBytesOfUser = 4 * 1024 * 1024;

/// Of one connection, then: a thousand short replies.
/// [UnreadReplies.BeyondItAreFewForEachClient,
/// ListenerUnreadRepliesAround.WhatAClientHasInNeedAreTakenUpToThat]
inline constexpr std::size_t kUnreadReplyBytesInNeed = 16 * 1024;

/// How long a client with more than `kUnreadReplyBytesToPause` unread, or more than
/// `kUnreadReplyBytesInNeed` where its user has too much, may read nothing at all before
/// it is cut off. A reply that is larger alone is sent whatever the others have; of those
/// that are not taken, once they are twice the user's share, the one that has waited
/// longest goes at once.
/// [UnixSocketListener.CutsOffAClientThatNeverReadsItsReplies,
/// UntakenReplies.AreCutOffBeyondTwiceTheUsersShareTheOldestFirst,
/// UntakenReplies.EndAClientThatReadsNothingWhileItsUserHasTooMuch]
inline constexpr std::chrono::seconds kUnreadPatience{3};

// Refusals

/// How long no connection is accepted once the process or the system has no
/// descriptor left.
/// [UnixSocketListener.AcceptsAgainOnceThereAreDescriptors]
inline constexpr std::chrono::milliseconds kAcceptBackOff{100};

/// How often one kind of misuse by one user is logged, or its use of others' sessions.
/// [MisuseLog.LogsAKindOfAUserAgainAfterTheInterval,
/// UsesOfOthers.AreToldOnceAMinuteForEachUserAndCountedEachTime]
inline constexpr std::chrono::seconds kMisuseLogInterval{60};

// What a session collects

/// Memory of what one session collects until its stop; what is more lies in a file.
/// A thousand messages of usual size, which few sessions reach.
/// [FileEntryStorageTest.LeavesAListInMemoryUpToItsShare]
inline constexpr std::size_t kListBytesInMemory = 256 * 1024;

/// The same of all sessions together: some dozens of long ones at a time, and a small
/// part of what the service may have. Beyond it short lists are in the file alone, and
/// each longer one has 1 KiB whatever the others have.
/// [FileEntryStorageTest.RefusesWhatFitsNeitherDiskNorMemory]
inline constexpr std::size_t kListsBytesInMemory = 6 * 1024 * 1024;

/// Of that, what waits for more of other sessions so that it is written to the file
/// together.
/// [SpillFileTest.GathersPiecesWhereThereIsMemoryForIt]
inline constexpr std::size_t kListsBytesBehind = 128 * 1024;

/// How long that file is left alone once it could not be written: a disk that is full
/// is not asked with each message.
/// [FileEntryStorageTest.LeavesAFullDiskAloneForAWhile]
inline constexpr std::chrono::milliseconds kPauseOfListsFile{1000};

// What comes from elsewhere

/// Sessions that watch the orientation of the device at a time, and that of the
/// interface. One that its client left while it was starting never ends, and costs some 5
/// KiB.
/// [OrientationWatchObservers.BeyondTheLimitTakeThePlaceOfTheOldest]
inline constexpr std::size_t kOrientationObservers = 2048;

/// Changes of orientation that are handed on in a second: hands turn a device less
/// often. What is more is dropped and counted.
/// [OrientationWatchObservers.AreSparedAFlood]
inline constexpr int kOrientationChangesPerSecond = 50;

/// How long an operation on drivers waits for one that does not answer: four in a row
/// hold the clients' requests up for 250 ms at most.
/// [MappedChannelReportingWaits.HoldACallerOfFourDriversForAQuarterSecondAtMost,
/// MappedChannelReportingHanging.GivesAnErrorAndHoldsTheCallerBrieflyOnce]
inline constexpr std::chrono::milliseconds kDriverWait{150};

/// Drivers that may hang at a time, a thread each.
/// [MappedChannelReportingHanging.OfAllDriversHoldsTheCallerBrieflyToo]
inline constexpr std::size_t kHangingDrivers = 4;

/// Channels of one driver group, in all its files: a report of that many is a payload
/// that is allowed.
/// [MappedChannelReportingSources.HaveTheMostChannelsInAll]
inline constexpr std::size_t kDriverChannels = 16384;

/// Files that are looked at in the directory of channels, of whatever kind.
/// [ChannelFileFinding.LooksAtTheMostFilesAndNoMore]
inline constexpr std::size_t kChannelFiles = 4096;

/// Of the defaults file: a dozen entries are a few hundred bytes.
/// [JSONUserDefaultsSuite.IsReadUpToTheLargestFile]
inline constexpr std::size_t kDefaultsFileBytes = 64 * 1024;

/// Of one text in it.
/// [JSONUserDefaultsSuite.MayHoldTextsUpToTheLongest]
inline constexpr std::size_t kDefaultsTextBytes = 4 * 1024;

/// Of the files with the device's facts.
/// [EtcDeviceInfoFiles.OfTheLargestSizeAreRead]
inline constexpr std::size_t kDeviceFileBytes = 64 * 1024;

// The store and the log

/// Memory of what waits for the store's writer, of all clients; what clients have under
/// way is mostly that. A message beyond it is refused with an error, an event dropped
/// and counted.
/// [StoreTest.RefusesMessagesBeyondTheBound]
inline constexpr std::size_t kStoreQueuedBytes = 64 * 1024 * 1024;

/// Analytics events that wait for it.
/// [StoreTest.DropsAnalyticsEventsBeyondTheBoundAndCountsThem]
inline constexpr std::size_t kStoreQueuedEvents = 100'000;

/// Operations that are kept while the file cannot be written: a quarter of a minute of a
/// busy device. The oldest are given up and counted.
/// [StoreFaults.GivesUpTheOldestInALongFaultAndCountsThem]
inline constexpr std::size_t kStoreKeptThroughFault = 16384;

/// Damaged files that are kept for those who want to know why.
/// [StoreFaults.KeepsOnlyTwoFilesSetAside]
inline constexpr std::size_t kStoreFilesSetAside = 2;

/// Of the store: more than a device reports in months, and a share of its flash that
/// nobody misses. The oldest rows go of the user who has most in it.
/// [StoreTest.RemovesTheOldestRowsOfALargeStore,
/// OwnersOfRows.KeepRowsThatOthersFlood]
inline constexpr std::int64_t kStoreBytes = std::int64_t{4} * 1024 * 1024 * 1024;

/// Of the disk's space, in percent, that the store does not grow into: beyond it rows go
/// for those that come.
/// [OwnersOfRows.AreCutBackOnADiskThatIsNearlyFull,
/// StoreDatabaseRoom.IsScarceBelowTheLimit]
inline constexpr std::int64_t kDiskPercentKeptFree = 5;

/// What it may have all the same, whoever filled the disk.
/// [OwnersOfRows.HaveTheirRowsOnANearlyFullDiskWhereTheStoreIsSmall]
inline constexpr std::int64_t kStoreBytesInNeed = 16 * 1024 * 1024;

/// Of the texts of one row, which SQLite puts together in memory: what it takes as a row
/// in any case, less the row's other columns. Only the summary of a session of many
/// hundred MiB may be more, where its characters take up to six in JSON. A row beyond it
/// is not stored, which is logged and counted, and those beside it are.
/// [StoreLongRows.AreStoredUpToTheLimit,
/// StoreLongRows.BeyondTheLimitAreToldAsLostAndCostNoOther]
inline constexpr std::size_t kStoreRowBytes = 999'999'000;

/// How old a row may become.
/// [StoreTest.RemovesRowsThatAreTooOld]
inline constexpr std::chrono::hours kStoreAge{24 * 30};

/// Log lines that wait for their reader. What is more is dropped, and a line says how
/// many were lost: nobody waits for the log.
/// [JournalLogLines.AreCountedWhereTheyAreLost]
inline constexpr std::size_t kLogWaitingBytes = 256 * 1024;

/// Of one log line; the rest is cut off.
/// [JournalLogLines.AreCutAtTheLongestLine]
inline constexpr std::size_t kLogLineBytes = 64 * 1024;

// Threads

/// Of each class of queues: two cores, and those that wait for files in the background.
/// [ThreadPoolWorkQueuesTest.HasAFewThreadsForAnyNumberOfQueues]
inline constexpr std::size_t kInteractiveThreads = 2;
inline constexpr std::size_t kUtilityThreads = 2;
inline constexpr std::size_t kBackgroundThreads = 4;

}  // namespace ostrel::limits
