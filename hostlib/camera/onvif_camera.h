// ONVIF (Profile S) camera driver behind CameraAPI, over HTTP with libcurl.
//
// The device service is at http://<host>:<port>/onvif/device_service. The
// Media and PTZ service paths come from GetServices (GetCapabilities when
// GetServices fails or names no Media service); only the path of a reported
// address is used, the configured host and port are kept, because a camera
// behind NAT or port forwarding reports its internal address. A snapshot URI
// that names the same internal host and port gets the configured port.
//
// Authentication: every request but the first GetSystemDateAndTime carries a
// WS-Security UsernameToken (PasswordDigest) whose Created is the local clock
// corrected by the camera's clock offset; GetSystemDateAndTime is retried
// signed when the camera refuses it unsigned, and the local clock is used when
// no UTC time is obtained. libcurl answers an HTTP 401 challenge with Digest or
// Basic. Any SOAP fault (whatever the HTTP status), an HTTP error, a reply
// that is not a SOAP envelope, a transport error or the timeout is a failure
// (-1); nothing is retried in a loop.
//
// Channel: the camera's `channel` text picks a video source, 1-based, in the
// order the sources first appear in GetProfiles; empty, 0 or not a number
// means the first. SetReso("WxH") picks that channel's profile whose encoder
// resolution is WxH (else its first profile) for GetSnapshotPath, which gives
// the snapshot URI's path with query, the port to use and the fetch type: 2
// when the URI serves a multipart stream (some cameras give their MJPEG stream
// as the snapshot URI), else 1; the driver learns it once per profile from the
// Content-Type of one GET that it ends at the first body byte. Presets
// belong to the PTZ unit: GetPresetList and GoPreset use the channel's first
// profile that has a PTZ configuration, whatever SetReso picked.
// Preset positions: see onvif_soap.h (decimal tokens are their number, other
// tokens a stable negative number). GoPreset with a negative position looks
// its token up in the camera's preset list; a position the camera does not
// have is a failure. GotoPreset carries only the preset token: GoPreset's
// name argument is not sent. GotoPreset returns before the camera arrives.
//
// Every CameraAPI call is bounded by CallTimeoutMs() in all (connect, all its
// requests). What is discovered about a camera (service paths, profiles,
// clock offset, the tokens of text presets, snapshot URIs) and its open HTTP
// connections are kept per "host:port" across control objects, thread-safely,
// and forgotten when a call fails; a call that failed on what was kept
// discovers afresh and tries once more (within the same time bound; not when
// the camera's fresh preset list lacks the position asked for). So with
// a warm cache GetPresetList and GoPreset each cost one round trip.
#ifndef HOSTLIB_ONVIF_CAMERA_H
#define HOSTLIB_ONVIF_CAMERA_H

#include <string>

#include "host/camera.h"

namespace onvif {

// Why the latest CameraAPI call of an ONVIF control object on this thread
// failed, for messages and exit codes; kNone after a success.
enum class Failure {
    kNone,
    kUnreachable,   // no answer: connection refused, timeout, no route, name unknown
    kUnauthorized,  // the camera refused the credentials (HTTP 401/403, SOAP NotAuthorized)
    kRefused,       // it answered, but refused the request or did not answer as ONVIF
    kNoSuchPreset,  // GoPreset: the camera's own preset list lacks the position
};
struct Diagnosis {
    Failure failure = Failure::kNone;
    std::string detail;  // one line: the request and the camera's answer or curl's error
};
Diagnosis LastDiagnosis();

CameraAPI* NewOnvifCamera(const std::string& host, int port, const std::string& username,
                          const std::string& password, const std::string& channel);

// Total time one CameraAPI call may take, in milliseconds (default 5000).
void SetCallTimeoutMs(int ms);
int CallTimeoutMs();

// Forgets what was discovered about every camera and closes kept connections.
void ForgetCameras();

}  // namespace onvif

#endif  // HOSTLIB_ONVIF_CAMERA_H
