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

-- Weekly guard schedules, read by the ptzpatrold service (see
-- hostlib/db/guard_schedule.h for when an entry is in force): on the
-- weekdays of `days` (bit 0 Monday ... bit 6 Sunday) from startTime to
-- endTime of the server's time zone, exclusive; an endTime at or before
-- startTime ends the next day, equal times make a whole day.
CREATE TABLE IF NOT EXISTS guard_schedule (
    id        serial  PRIMARY KEY,
    camId     integer NOT NULL,
    days      integer NOT NULL DEFAULT 127 CHECK (days BETWEEN 1 AND 127),
    startTime time(0) NOT NULL DEFAULT '00:00' CHECK (startTime < '24:00'),
    endTime   time(0) NOT NULL DEFAULT '00:00' CHECK (endTime < '24:00'),
    patrolId  integer NOT NULL,
    mode      integer NOT NULL CHECK (mode BETWEEN 0 AND 4),  -- off, continuous, first, second, any event
    repeatCount       integer NOT NULL DEFAULT 1 CHECK (repeatCount >= 0),  -- 0: without end
    pauseMinutes      integer NOT NULL DEFAULT 1 CHECK (pauseMinutes BETWEEN 0 AND 35),
    eventValidSeconds integer NOT NULL DEFAULT 10 CHECK (eventValidSeconds BETWEEN 0 AND 2147)
);
CREATE INDEX IF NOT EXISTS guard_schedule_camid ON guard_schedule (camId);
