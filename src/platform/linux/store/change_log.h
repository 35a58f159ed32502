// What the store keeps besides the four tables: vireo-forwarder's cursors, the log
// of changes to rows it may already have sent, and the count of rows the disk quota
// deleted, per table (forwarded: already sent; unforwarded: lost to the fleet). Both
// the daemon's store and the forwarder run this (IF NOT EXISTS), so a store made by an
// older daemon gets it from whichever opens it first.
//
// A telemetry_sessions row changes after it is written (backends, then flushed_at).
// The trigger logs a change only for rows up to the forwarder's watch mark, which
// the forwarder raises before it reads new session rows: a row it has not read yet
// will be read in its latest state anyway, and a store without a forwarder logs
// nothing at all.
#pragma once

namespace vireo::linux_platform {

inline constexpr const char* kChangeLogSchema = R"sql(
CREATE TABLE IF NOT EXISTS forward_state (name TEXT PRIMARY KEY, value INTEGER);
CREATE TABLE IF NOT EXISTS store_changes (
  seq INTEGER PRIMARY KEY AUTOINCREMENT, tbl TEXT NOT NULL, row INTEGER NOT NULL);
CREATE TABLE IF NOT EXISTS store_dropped (
  tbl TEXT PRIMARY KEY, forwarded INTEGER NOT NULL DEFAULT 0, unforwarded INTEGER NOT NULL DEFAULT 0);
CREATE TRIGGER IF NOT EXISTS telemetry_sessions_changed AFTER UPDATE ON telemetry_sessions
WHEN NEW.id <= (SELECT value FROM forward_state WHERE name = 'telemetry_sessions.watched')
BEGIN
  INSERT INTO store_changes (tbl, row) VALUES ('telemetry_sessions', NEW.id);
END;
)sql";

// The forward_state name of the watch mark.
inline constexpr const char* kSessionsWatchedName = "telemetry_sessions.watched";

}  // namespace vireo::linux_platform
