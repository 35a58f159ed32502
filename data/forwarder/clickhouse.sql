-- The fleet database of vireo-forwarder (ClickHouse 18.16 or later).
--
-- One table per table of the device's store, with the same name and columns, after
-- the device (application-specific id) and the local row id, and before the version:
-- 0 for a row sent as new, the change-log sequence number for a row sent again after
-- it changed. Rows collapse by (device, id) keeping the highest version, so
--   SELECT count() FROM vireo.telemetry_messages FINAL
-- counts every local row once, in its latest state.
--
-- store_dropped: the rows the device's disk quota deleted, per local table, those
-- already forwarded and those lost to this database. The counts only grow, so their
-- sum is the version and FINAL shows the latest; at is the device's time of the pass.
--
-- vireo-forwarder runs these statements itself when a table is missing, with the
-- database of Database= in place of vireo. By hand:
--   clickhouse-client --multiquery < clickhouse.sql

CREATE DATABASE IF NOT EXISTS vireo;

CREATE TABLE IF NOT EXISTS vireo.telemetry_sessions (
  device       String,
  id           UInt64,
  session_info String,
  user_info    String,
  backends     Nullable(String),
  created_at   Float64,
  flushed_at   Nullable(Float64),
  version      UInt64
) ENGINE = ReplacingMergeTree(version) ORDER BY (device, id);

CREATE TABLE IF NOT EXISTS vireo.telemetry_messages (
  device       String,
  id           UInt64,
  session      Nullable(Int64),
  session_info Nullable(String),
  user_info    Nullable(String),
  category     Int64,
  `type`       Int64,
  payload      String,
  sent_at      Float64,
  version      UInt64
) ENGINE = ReplacingMergeTree(version) ORDER BY (device, id);

CREATE TABLE IF NOT EXISTS vireo.analytics_events (
  device       String,
  id           UInt64,
  name         String,
  payload      String,
  `at`         Float64,
  version      UInt64
) ENGINE = ReplacingMergeTree(version) ORDER BY (device, id);

CREATE TABLE IF NOT EXISTS vireo.energy_events (
  device       String,
  id           UInt64,
  client       Int64,
  name         String,
  payload      String,
  `at`         Float64,
  version      UInt64
) ENGINE = ReplacingMergeTree(version) ORDER BY (device, id);

CREATE TABLE IF NOT EXISTS vireo.store_dropped (
  device       String,
  tbl          String,
  forwarded    UInt64,
  unforwarded  UInt64,
  `at`         Float64,
  version      UInt64
) ENGINE = ReplacingMergeTree(version) ORDER BY (device, tbl);
