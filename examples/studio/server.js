#!/usr/bin/env node
'use strict';
// A local control page for the add-on: sources, live previews, level meters, record buttons,
// the clips and the add-on's warning lines. Serves 127.0.0.1 only.
//   node examples/studio/server.js [port] [clip folder]
// Without DISPLAY or PULSE_SERVER it starts a private virtual desktop, sound server and test
// cameras, as the demo does.
const { fork, execFile } = require('child_process');
const fs = require('fs');
const http = require('http');
const path = require('path');
const readline = require('readline');
const send = require('send');
const { WebSocketServer } = require('ws');
const { startDesktop, startAnimation, playTone } = require('../../scripts/desktop');

const port = Number(process.argv[2] || 0);
const PAGE = path.join(__dirname, 'page');
const WARNING = /^\d+: Warning: /;
const KEPT_WARNINGS = 200;

const state = {
  folder: path.resolve(process.argv[3] || path.join('out', 'studio')),
  sources: [],
  recording: new Map(),  // uid -> filename
  clips: [],
  warnings: [],
};
const clients = new Set();

function broadcast(message) {
  const text = JSON.stringify(message);
  for (const ws of clients) ws.send(text);
}

async function startPrivateServers() {
  const givenDisplay = Boolean(process.env.DISPLAY);
  const givenSound = Boolean(process.env.PULSE_SERVER);
  const desktop = await startDesktop({ private: false });
  const helpers = [];
  const env = { ...desktop.env };
  if (!givenDisplay) {
    helpers.push(startAnimation(desktop.env, { x: 200, y: 150 }));
    console.log(`studio: private display ${desktop.env.DISPLAY} with a moving picture`);
    if (process.env.TAVIO_TEST_CAMERAS === undefined) {
      env.TAVIO_TEST_CAMERAS =
        'Studio Test Camera=testsrc2=size=640x480:rate=30;Studio H.264 Camera=h264:smptebars=size=640x360:rate=30';
      console.log('studio: test cameras "Studio Test Camera" and "Studio H.264 Camera"');
    }
  }
  if (!givenSound) {
    helpers.push(playTone(desktop.env, { frequency: 440 }));
    console.log(`studio: private sound server ${desktop.env.PULSE_SERVER} with a 440 Hz tone playing`);
  }
  return { env, stop: () => { helpers.forEach((h) => h.kill()); desktop.stop(); } };
}

function kindOf(source) {
  return source.type === 'dxgi' || source.type === 'mfce_video' ? 'video' : 'audio';
}

// Duration in seconds once the recorder has finished the file, else null.
function probeDuration(file) {
  return new Promise((resolve) => {
    execFile('ffprobe', ['-v', 'error', '-show_entries', 'format=duration', '-of', 'csv=p=0', file], (error, stdout) => {
      const seconds = Number(stdout);
      resolve(error || !Number.isFinite(seconds) || seconds <= 0 ? null : seconds);
    });
  });
}

// The recorder finishes the file on its own thread after stopCapture, writing its index last;
// the clip is listed once ffprobe reads a duration and the size stays the same after that.
async function watchClip(uid, filename) {
  const source = state.sources.find((s) => s.id === uid);
  const sizeOf = () => (fs.existsSync(filename) ? fs.statSync(filename).size : -1);
  let probed = null;  // { duration, size } of the last readable look
  for (let attempt = 0; attempt < 60; attempt++) {
    await new Promise((resolve) => setTimeout(resolve, 250));
    const size = sizeOf();
    if (probed && size === probed.size) {
      const clip = { id: state.clips.length, uid, name: path.basename(filename), kind: kindOf(source), ...probed };
      clip.url = `/clips/${clip.id}`;
      state.clips.push({ ...clip, filename });
      broadcast({ type: 'clip', clip });
      return;
    }
    const duration = size > 0 ? await probeDuration(filename) : null;
    probed = duration === null ? null : { duration, size: sizeOf() };
  }
  broadcast({ type: 'clip failed', uid, name: path.basename(filename) });
}

function startEngine(env) {
  const engine = fork(path.join(__dirname, 'engine.js'), [], {
    env: { ...process.env, ...env },
    stdio: ['ignore', 'pipe', 'inherit', 'pipe', 'ipc'],
  });
  readWarnings(engine.stdout);
  readFrames(engine.stdio[3]);
  engine.on('message', (message) => {
    if (message.type === 'event' && message.event.type === 'new source') {
      state.sources.push(message.event.source);
      broadcast({ type: 'source', source: message.event.source });
    } else if (message.type === 'levels') {
      broadcast(message);
    } else if (message.type === 'ready') {
      engine.ready = true;
    }
  });
  return engine;
}

// The add-on writes its warning lines straight to its standard output. A failure's text from
// checkResult goes on over lines that start with a tab; they belong to the warning above them.
function readWarnings(stream) {
  let warning = null;
  let timer = null;
  const finish = () => {
    clearTimeout(timer);
    if (warning === null) return;
    state.warnings.push(warning);
    if (state.warnings.length > KEPT_WARNINGS) state.warnings.shift();
    broadcast({ type: 'warning', line: warning });
    warning = null;
  };
  readline.createInterface({ input: stream }).on('line', (line) => {
    console.log(line);
    if (warning !== null && line.startsWith('\t')) {
      warning += `\n${line}`;
    } else {
      finish();
      if (WARNING.test(line)) warning = line;
    }
    // A warning is written in one piece: its lines arrive together.
    clearTimeout(timer);
    if (warning !== null) timer = setTimeout(finish, 20);
  });
}

// Frames arrive as [u32 length][length bytes]; the bytes after the length are the WebSocket
// message. A page whose socket still holds several earlier pictures skips this one.
function readFrames(stream) {
  let chunks = [];
  let have = 0;
  let need = -1;
  stream.on('data', (chunk) => {
    chunks.push(chunk);
    have += chunk.length;
    for (;;) {
      if (need < 0) {
        if (have < 4) return;
        const head = chunks.length === 1 ? chunks[0] : Buffer.concat(chunks);
        need = head.readUInt32LE(0);
        chunks = [head.subarray(4)];
        have -= 4;
      }
      if (have < need) return;
      const all = chunks.length === 1 ? chunks[0] : Buffer.concat(chunks);
      const frame = all.subarray(0, need);
      chunks = [all.subarray(need)];
      have -= need;
      need = -1;
      const uid = frame.readUInt32LE(0);
      for (const ws of clients) {
        if (ws.previews.has(uid) && ws.bufferedAmount < 6 * frame.length) ws.send(frame, { binary: true });
      }
    }
  });
}

// What every page asks for, merged: the highest rate and the largest size per source.
function updatePreviews(engine) {
  const wanted = new Map();
  for (const ws of clients) {
    for (const [uid, p] of ws.previews) {
      const w = wanted.get(uid) || { uid, width: 0, height: 0, rate: 0 };
      wanted.set(uid, { uid, width: Math.max(w.width, p.width), height: Math.max(w.height, p.height), rate: Math.max(w.rate, p.rate) });
    }
  }
  for (const source of state.sources.filter((s) => s.width)) {
    engine.send({ type: 'preview', ...(wanted.get(source.id) || { uid: source.id, width: 0, height: 0, rate: 0 }) });
  }
  engine.send({ type: 'levels', on: clients.size > 0 });
}

function startClip(engine, uid) {
  const source = state.sources.find((s) => s.id === uid);
  if (!source || state.recording.has(uid)) return;
  const stamp = new Date().toISOString().replace(/[:.]/g, '-');
  const safe = source.name.replace(/[^A-Za-z0-9_-]+/g, '_');
  const filename = path.join(state.folder, `${safe}-${uid}-${stamp}.mp4`);
  state.recording.set(uid, filename);
  engine.send({ type: 'start', uid, filename });
  broadcast({ type: 'recording', uid, on: true, filename });
}

function stopClip(engine, uid) {
  const filename = state.recording.get(uid);
  if (filename === undefined) return;
  state.recording.delete(uid);
  engine.send({ type: 'stop', uid });
  broadcast({ type: 'recording', uid, on: false, filename });
  watchClip(uid, filename);
}

function handleMessage(engine, ws, message) {
  switch (message.type) {
    case 'preview':
      if (message.rate > 0) ws.previews.set(message.uid, message);
      else ws.previews.delete(message.uid);
      updatePreviews(engine);
      break;
    case 'record': startClip(engine, message.uid); break;
    case 'stop': stopClip(engine, message.uid); break;
    case 'record all': state.sources.forEach((s) => startClip(engine, s.id)); break;
    case 'stop all': [...state.recording.keys()].forEach((uid) => stopClip(engine, uid)); break;
    case 'folder':
      // The folder is used as given: a missing one makes the add-on warn, which the page shows.
      if (typeof message.folder === 'string' && message.folder) state.folder = path.resolve(message.folder);
      broadcast({ type: 'folder', folder: state.folder });
      break;
    default: break;
  }
}

function serve(req, res) {
  const url = new URL(req.url, 'http://127.0.0.1');
  const clip = url.pathname.match(/^\/clips\/(\d+)$/);
  if (clip) {
    const found = state.clips[Number(clip[1])];
    if (!found) { res.writeHead(404).end(); return; }
    send(req, found.filename).pipe(res);
    return;
  }
  const name = url.pathname === '/' ? '/index.html' : url.pathname;
  send(req, name, { root: PAGE }).on('error', (e) => res.writeHead(e.status || 500).end()).pipe(res);
}

async function main() {
  fs.mkdirSync(state.folder, { recursive: true });
  const servers = await startPrivateServers();
  const engine = startEngine(servers.env);
  const http_ = http.createServer(serve);
  const wss = new WebSocketServer({ server: http_, path: '/live' });
  wss.on('connection', (ws) => {
    ws.previews = new Map();
    clients.add(ws);
    const clips = state.clips.map(({ filename, ...clip }) => clip);
    ws.send(JSON.stringify({ type: 'hello', sources: state.sources, clips, warnings: state.warnings,
      folder: state.folder, recording: [...state.recording.keys()] }));
    ws.on('message', (data, binary) => {
      if (binary) return;
      try {
        handleMessage(engine, ws, JSON.parse(data));
      } catch (_) { /* a malformed message is ignored */ }
    });
    ws.on('close', () => { clients.delete(ws); updatePreviews(engine); });
    updatePreviews(engine);
  });

  let stopping = false;
  const stop = () => {
    if (stopping) return;
    stopping = true;
    for (const ws of clients) ws.terminate();
    http_.close();
    engine.kill('SIGTERM');
    const done = () => { servers.stop(); process.exit(0); };
    if (engine.exitCode !== null || engine.signalCode !== null) done();
    else engine.on('exit', done);
  };
  process.on('SIGINT', stop);
  process.on('SIGTERM', stop);
  engine.on('exit', (code, signal) => {
    if (stopping) return;
    console.error(`studio: the add-on process ended (${signal || code})`);
    stopping = true;
    servers.stop();
    process.exit(1);
  });

  http_.listen(port, '127.0.0.1', () => {
    console.log(`studio: add-on process ${engine.pid}, clips in ${state.folder}`);
    console.log(`studio: open http://127.0.0.1:${http_.address().port}/`);
  });
}

main().catch((error) => {
  console.error(error);
  process.exit(1);
});
