#pragma once

namespace yomber {

/// A store as the program of version 1 left it: two zones, a record with a value of each kind, a
/// deletion, a quota. Never changed: such stores are what later versions must read.
inline constexpr const char* kVersion1Store = R"sql(
PRAGMA journal_mode=WAL;
BEGIN TRANSACTION;
CREATE TABLE meta(key TEXT PRIMARY KEY, value INTEGER NOT NULL) WITHOUT ROWID;
INSERT INTO meta VALUES('identity',6097804876250223887);
CREATE TABLE account(name BLOB PRIMARY KEY, quota INTEGER) WITHOUT ROWID;
INSERT INTO account VALUES(X'616e6e',1000000);
CREATE TABLE zone(
    id INTEGER PRIMARY KEY AUTOINCREMENT,
    container BLOB NOT NULL,
    owner BLOB NOT NULL,
    name BLOB NOT NULL,
    sequence INTEGER NOT NULL,
    forgotten INTEGER NOT NULL,
    tombstones INTEGER NOT NULL,
    charge INTEGER NOT NULL,
    dead INTEGER NOT NULL);
INSERT INTO zone VALUES(
  1,X'636f6d2e6578616d706c652e6472697665',X'616e6e',X'646f63756d656e7473',4,0,1,225,0);
INSERT INTO zone VALUES(
  2,X'636f6d2e6578616d706c652e6472697665',X'616e6e',X'7069637475726573',0,0,0,0,0);
CREATE TABLE record(
    id INTEGER PRIMARY KEY,
    zone INTEGER NOT NULL,
    name BLOB NOT NULL,
    type BLOB NOT NULL,
    sequence INTEGER NOT NULL,
    created INTEGER NOT NULL,
    modified INTEGER NOT NULL,
    charge INTEGER NOT NULL,
    body BLOB NOT NULL);
INSERT INTO record VALUES(
  1,1,X'7265706f7274',X'646f63756d656e74',1,1760000000000000001,1760000000000000001,206,
  X'0108056279746573020200ff07636f6e74656e74086b7bd4f4361ff282256b274fc2bfe6f09eba135e8debcd036e59b6ef2e2c8c801404646174650515cd853dfe9c9717046e616d65010a7265706f72742e706466066e756d62657203fbffffffffffffff06706172656e740704726f6f7409646f63756d656e74730f5f5f63757272656e74557365725f5f05726174696f040000000000000440047461677306020372656405677265656e');
INSERT INTO record VALUES(
  2,1,X'726f6f74',X'666f6c646572',2,1760000000000000001,1760000000000000001,19,
  X'0101046e616d650100');
CREATE TABLE tombstone(
    zone INTEGER NOT NULL,
    sequence INTEGER NOT NULL,
    name BLOB NOT NULL,
    type BLOB NOT NULL,
    PRIMARY KEY(zone, sequence)) WITHOUT ROWID;
INSERT INTO tombstone VALUES(1,4,X'676f6e65',X'646f63756d656e74');
CREATE TABLE asset(
    hash BLOB PRIMARY KEY,
    size INTEGER NOT NULL,
    uses INTEGER NOT NULL,
    released INTEGER NOT NULL) WITHOUT ROWID;
INSERT INTO asset VALUES(
  X'6b7bd4f4361ff282256b274fc2bfe6f09eba135e8debcd036e59b6ef2e2c8c80',20,1,0);
DELETE FROM sqlite_sequence;
INSERT INTO sqlite_sequence VALUES('zone',2);
CREATE UNIQUE INDEX zone_name ON zone(container, owner, name) WHERE dead=0;
CREATE INDEX zone_owner ON zone(owner) WHERE dead=0;
CREATE INDEX zone_dead ON zone(id) WHERE dead=1;
CREATE UNIQUE INDEX record_name ON record(zone, name);
CREATE UNIQUE INDEX record_change ON record(zone, sequence);
CREATE INDEX record_type ON record(zone, type, name);
CREATE UNIQUE INDEX tombstone_name ON tombstone(zone, name);
CREATE INDEX asset_released ON asset(released) WHERE uses=0;
COMMIT;
PRAGMA application_id=1381659508;
PRAGMA user_version=1;
)sql";

/// What makes a store of version 2 of it, in which bob reads ann's documents. Never changed either.
inline constexpr const char* kVersion2Additions = R"sql(
BEGIN TRANSACTION;
CREATE TABLE member(
    zone INTEGER NOT NULL,
    account BLOB NOT NULL,
    permission INTEGER NOT NULL,
    PRIMARY KEY(zone, account)) WITHOUT ROWID;
INSERT INTO member VALUES(1,X'626f62',0);
CREATE INDEX member_account ON member(account);
COMMIT;
PRAGMA user_version=2;
)sql";

/// The change token that a reader of its zone "documents" had kept, in hexadecimal.
inline constexpr const char* kVersion1Token = "010f158a363ac19f54010404e1eb20126bbf3aad";

/// The content of its asset.
inline constexpr const char* kVersion1Content = "kept since version 1";

}  // namespace yomber
