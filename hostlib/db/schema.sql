-- Tables of the patrol store and the camera records the host layer reads.
-- Unquoted names fold to lower case (camId is stored as camid); the library's
-- statements spell them in camel case and reach the same columns.
-- Safe to run again: it creates only what is missing.
SET client_min_messages = warning;

CREATE TABLE IF NOT EXISTS patrol (
    id        serial  PRIMARY KEY,
    camId     integer NOT NULL,
    name      text    NOT NULL DEFAULT '',
    stayTime  integer NOT NULL DEFAULT 0
);
CREATE INDEX IF NOT EXISTS patrol_camid ON patrol (camId);

CREATE TABLE IF NOT EXISTS patrol_preset (
    id        serial  PRIMARY KEY,
    camId     integer NOT NULL,
    patrolId  integer NOT NULL,
    position  integer NOT NULL,
    name      text    NOT NULL DEFAULT '',
    sequence  integer NOT NULL
);
CREATE INDEX IF NOT EXISTS patrol_preset_patrolid ON patrol_preset (patrolId, sequence);

CREATE TABLE IF NOT EXISTS camera (
    id        integer PRIMARY KEY,
    host      text    NOT NULL DEFAULT '',
    port      integer NOT NULL DEFAULT 80,
    username  text    NOT NULL DEFAULT '',
    password  text    NOT NULL DEFAULT '',
    vendor    text    NOT NULL DEFAULT '',
    model     text    NOT NULL DEFAULT '',
    channel   text    NOT NULL DEFAULT '',
    path      text    NOT NULL DEFAULT '',
    liveReso  text    NOT NULL DEFAULT '',
    snapshotType integer NOT NULL DEFAULT 1  -- user-defined cameras: 1 image, 2 MJPEG stream at path
);
-- Tables made before the column existed.
ALTER TABLE camera ADD COLUMN IF NOT EXISTS snapshotType integer NOT NULL DEFAULT 1;
