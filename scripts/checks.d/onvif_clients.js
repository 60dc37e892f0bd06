// Third-party ONVIF clients against the camera simulator: each connects,
// lists presets, moves to one and fetches the snapshot; one also receives a
// motion event over PullPoint. Every call runs under its own timeout. Then a
// wrong password must fail (or time out) without a move.
//   node onvif_clients.js <port>
'use strict';
const http = require('http');
const crypto = require('crypto');
const { Cam } = require('onvif');
const nodeOnvif = require('node-onvif');

const port = Number(process.argv[2]);
const CALL_TIMEOUT_MS = 10000;

function within(what, promise, ms = CALL_TIMEOUT_MS) {
  let timer;
  const timeout = new Promise((_, reject) => {
    timer = setTimeout(() => reject(new Error(`${what}: no answer within ${ms} ms`)), ms);
  });
  return Promise.race([promise, timeout]).finally(() => clearTimeout(timer));
}

function call(fn) {
  return new Promise((resolve, reject) => fn((err, result) => (err ? reject(err) : resolve(result))));
}

function get(url, headers = {}) {
  return new Promise((resolve, reject) => {
    http.get(url, { headers }, (res) => {
      const chunks = [];
      res.on('data', (c) => chunks.push(c));
      res.on('end', () => resolve({ res, body: Buffer.concat(chunks) }));
      res.on('error', reject);
    }).on('error', reject);
  });
}

// GET with HTTP Digest (qop=auth, MD5), as the simulator asks for it.
async function digestGet(url, user, pass) {
  const first = await get(url);
  if (first.res.statusCode !== 401) return first;
  const challenge = first.res.headers['www-authenticate'] || '';
  const p = {};
  challenge.replace(/(\w+)="?([^",]*)"?/g, (_, k, v) => { p[k] = v; });
  const md5 = (s) => crypto.createHash('md5').update(s).digest('hex');
  const u = new URL(url);
  const uri = u.pathname + u.search;
  const cnonce = crypto.randomBytes(8).toString('hex');
  const nc = '00000001';
  const response = md5(`${md5(`${user}:${p.realm}:${pass}`)}:${p.nonce}:${nc}:${cnonce}:auth:${md5(`GET:${uri}`)}`);
  const auth = `Digest username="${user}", realm="${p.realm}", nonce="${p.nonce}", uri="${uri}", ` +
               `qop=auth, nc=${nc}, cnonce="${cnonce}", response="${response}"`;
  return get(url, { Authorization: auth });
}

function isJpeg(buf) { return buf.length > 100 && buf[0] === 0xff && buf[1] === 0xd8; }

async function withOnvif(password) {
  const cam = new Cam({ hostname: '127.0.0.1', port, username: 'admin', password,
                        timeout: 5000, autoconnect: false, preserveAddress: true });
  await within('onvif connect', call((cb) => cam.connect(cb)));
  const presets = await within('onvif getPresets', call((cb) => cam.getPresets({}, cb)));
  // name -> preset ({$: {token}}) in this version; plain tokens in older ones
  const tokens = Object.values(presets).map((v) => String(v && v.$ ? v.$.token : v));
  if (!tokens.includes('5')) throw new Error(`onvif: preset 5 missing in ${JSON.stringify(presets)}`);
  await within('onvif gotoPreset', call((cb) => cam.gotoPreset({ preset: '5' }, cb)));
  const uri = await within('onvif getSnapshotUri', call((cb) => cam.getSnapshotUri({}, cb)));
  const snap = await within('onvif snapshot', digestGet(uri.uri, 'admin', password));
  if (snap.res.statusCode !== 200 || !isJpeg(snap.body)) throw new Error('onvif: snapshot is not a JPEG');
  console.log(`onvif: ${tokens.length} presets, moved to 5, snapshot ${snap.body.length} bytes`);
  await motionEvent(cam);
}

function post(path, body) {
  return new Promise((resolve, reject) => {
    const req = http.request({ host: '127.0.0.1', port, path, method: 'POST' }, (res) => {
      res.resume();
      res.on('end', () => resolve(res.statusCode));
    });
    req.on('error', reject);
    req.end(body);
  });
}

// The client's own PullPoint subscription sees the motion alarm raised on the camera.
async function motionEvent(cam) {
  const seen = new Promise((resolve) => {
    cam.on('event', (m) => {
      const topic = String(m.topic && m.topic._ !== undefined ? m.topic._ : m.topic);
      const item = m.message && m.message.message && m.message.message.data &&
                   m.message.message.data.simpleItem;
      const value = item && item.$ ? item.$.Value : undefined;
      if (topic.endsWith('VideoSource/MotionAlarm') && String(value) === 'true') resolve(topic);
    });
  });
  // Raised once the client's subscription exists (polled, at most 10 s).
  for (let i = 0; ; ++i) {
    const live = await get(`http://127.0.0.1:${port}/control/subscriptions`);
    if (Number(live.body.toString()) > 0) break;
    if (i === 200) throw new Error('onvif: no event subscription made');
    await new Promise((r) => setTimeout(r, 50));
  }
  await post('/control/event', 'motion=1');
  const topic = await within('onvif motion event', seen);
  cam.removeAllListeners('event');
  await post('/control/event', 'motion=0');
  console.log(`onvif: event ${topic} true`);
}

async function withNodeOnvif(password) {
  const device = new nodeOnvif.OnvifDevice({
    xaddr: `http://127.0.0.1:${port}/onvif/device_service`, user: 'admin', pass: password });
  await within('node-onvif init', device.init());
  const profile = device.getCurrentProfile();
  const result = await within('node-onvif getPresets',
    device.services.ptz.getPresets({ ProfileToken: profile.token }));
  let list = result.data.GetPresetsResponse.Preset;
  list = Array.isArray(list) ? list : [list];
  const tokens = list.map((p) => p.$.token);
  if (!tokens.includes('9')) throw new Error(`node-onvif: preset 9 missing in ${tokens}`);
  await within('node-onvif gotoPreset',
    device.services.ptz.gotoPreset({ ProfileToken: profile.token, PresetToken: '9' }));
  const snap = await within('node-onvif fetchSnapshot', device.fetchSnapshot());
  if (!isJpeg(snap.body)) throw new Error('node-onvif: snapshot is not a JPEG');
  console.log(`node-onvif: ${tokens.length} presets, moved to 9, snapshot ${snap.body.length} bytes`);
}

// A wrong password must not succeed; a client that hangs instead of failing
// is cut off by the timeout (and reported).
async function refused(name, run) {
  try {
    await run('wrong');
  } catch (e) {
    console.log(`${name} with a wrong password: failed as it should (${e.message.split('\n')[0]})`);
    return;
  }
  throw new Error(`${name}: a wrong password was accepted`);
}

(async () => {
  await withOnvif('secret');
  await withNodeOnvif('secret');
  await refused('onvif', withOnvif);
  await refused('node-onvif', withNodeOnvif);
  process.exit(0);
})().catch((e) => {
  console.error(`FAILED: ${e.stack || e}`);
  process.exit(1);
});
