// Still images from cameras: one JPEG fetched into memory (over HTTP or as the
// first part of a multipart stream), and the per-camera snapshot files under
// /tmp/. Nothing here writes to the system log; every failure is -1.
#ifndef SNAPSHOT_SNAPSHOT_H
#define SNAPSHOT_SNAPSHOT_H

#include <string>

#include "common/export.h"
#include "host/camera.h"

// Largest image accepted, in bytes (64 MiB): a lying or endless stream fails
// instead of growing a buffer without bound.
constexpr int kSnapshotMaxBytes = 67108864;

// Fetches one image from the camera at host:port. `api` (owned by the caller)
// is given `reso` and then says where the image is served. On 0, *buffer holds
// *size image bytes and belongs to the caller, who releases it with
// SnapshotFree. On -1, *buffer is null when a fetch was started, or as the
// caller left it when the failure came before (a null output, SetReso or
// GetSnapshotPath refused, an unknown fetch type); *size then has no meaning.
PTZ_EXPORT int SnapshotGet(std::string host, int port, std::string username, std::string password,
                           CameraAPI& api, std::string reso, unsigned char** buffer, int* size);

// Releases a buffer from SnapshotGet; null is ignored.
PTZ_EXPORT void SnapshotFree(unsigned char* buffer);

// Takes a fresh image from `camera` (its record already loaded) and replaces
// the camera's file "/tmp/ov_snapshot_id_<id>.jpg" with it atomically: a
// reader sees the old image or the new one, never part of one. 0: written;
// -1: null camera, no control object, fetch or write failed (the old file,
// if any, is left as it was).
PTZ_EXPORT int SnapshotFileGet(Camera* camera);

// Removes the snapshot file of camera `camId`. Always 0.
PTZ_EXPORT int SnapshotFileDelete(int camId);

#endif  // SNAPSHOT_SNAPSHOT_H
