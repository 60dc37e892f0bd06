// The snapshot type of user-defined cameras, as their records say.
#ifndef HOSTLIB_CAMERA_USER_DEFINED_H
#define HOSTLIB_CAMERA_USER_DEFINED_H

#include <string>

// Remembers that the camera at host:port serves its images at `path` as
// `type` (1 single image, 2 multipart stream). Camera::Load calls it for every
// record it reads, so that newUserDefinedAPI, which the snapshot code calls
// with the type "1" and no record, fetches a stream camera as a stream.
// Thread-safe.
void HostNoteSnapshotType(const std::string& host, int port, const std::string& path, int type);

#endif  // HOSTLIB_CAMERA_USER_DEFINED_H
