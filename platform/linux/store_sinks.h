#pragma once

#include <memory>
#include <optional>

#include "common/Value.h"
#include "platform/analytics.h"
#include "platform/enerdex.h"
#include "platform/linux/reporting_store.h"
#include "platform/livo_reporting.h"

namespace qn {

// The platform sinks on top of the reporting store. Each keeps a reference to the store;
// every call only hands a record to it (no call waits for a disk). Safe from any thread.

struct StoreLivoReportingOptions {
  // What backend discovery (LivoReportingSession::StartConfiguration) answers. nullopt
  // means "no backends": the handler is then called with nullopt, so a session's wait for
  // backends runs and times out.
  std::optional<Array> backends = Array{Value("reports.db")};
};

// LivoReporting on the store:
//   - NewSecureHierarchyTokenFromParentToken: tokens with increasing ids (from 1, per
//     object); the parent is ignored.
//   - CreateSession: allocates a session row id and hands over a livo_sessions row with the
//     session info and user info; frameworks_to_check is ignored. The session's
//     Description() is "<LivoReportingSession ID>" with its row id.
//   - StartConfiguration: calls the handler once, on the store's writer thread after the
//     session row was written (never on the caller's stack), with the configured backends.
//   - SendMessage: hands over a livo_messages row of the session and returns true; false
//     with an error when the store dropped it (queue full or closed).
//   - FlushMessages: sets the session's flushed time; the handler runs on the writer thread
//     once that is committed (with the store's error when the write failed).
//   - SendOneMessage: a livo_messages row of no session with the given session info and
//     user info; true, or false with an error as SendMessage.
// REQUIRES: `store` is not null.
std::shared_ptr<LivoReporting> NewStoreLivoReporting(std::shared_ptr<ReportingStore> store,
                                                     StoreLivoReportingOptions options = {});

// Analytics on the store: SendEventLazy hands over an analytics_events row; the provider is
// called on the writer thread when the row is written. REQUIRES: `store` is not null.
std::shared_ptr<Analytics> NewStoreAnalytics(std::shared_ptr<ReportingStore> store);

// Enerdex (power log) on the store: LogRegisteredEvent hands over a powerlog_events row
// (subsystem, event name, payload); the options are not kept. REQUIRES: `store` is not null.
std::shared_ptr<Enerdex> NewStoreEnerdex(std::shared_ptr<ReportingStore> store);

}  // namespace qn
