'use strict';
// The studio's add-on process. It runs apart from the web server because the add-on prints its
// warning lines on this process's standard output, which the server reads line by line.
// Commands and events travel over the IPC channel as JSON; preview pictures go over fd 3 as
// frames of [u32 length][u32 uid][u32 width][u32 height][RGBA], little-endian, so the server can
// hand everything after the length to a WebSocket as it is.
const net = require('net');
const addon = require('../..');

const HEADER = 16;
const LEVEL_INTERVAL_MS = 50;
// While the server is more than a few pictures behind, new ones are skipped: a slow reader sees
// fewer frames, never older ones.
const MAX_QUEUED_BYTES = 8 * 1024 * 1024;

const frames = new net.Socket({ fd: 3, readable: false });
frames.on('error', () => process.exit(0));
const sources = new Map();
const previews = new Map();  // uid -> { width, height, period, next, timer }
let levelTimer = null;

function send(message) {
  if (process.connected) process.send(message);
}

function sendFrame(uid, width, height) {
  if (frames.writableLength > MAX_QUEUED_BYTES) return;
  const pixels = addon.getPreview(uid, width, height);
  if (!pixels) return;
  const header = Buffer.alloc(HEADER);
  header.writeUInt32LE(HEADER - 4 + pixels.byteLength, 0);
  header.writeUInt32LE(uid, 4);
  header.writeUInt32LE(width, 8);
  header.writeUInt32LE(height, 12);
  frames.cork();
  frames.write(header);
  frames.write(Buffer.from(pixels.buffer, pixels.byteOffset, pixels.byteLength));
  frames.uncork();
}

// Timed from a fixed start, so timer lateness does not pile up into a lower rate.
function schedule(uid, preview) {
  preview.next += preview.period;
  const now = performance.now();
  if (preview.next < now) preview.next = now;
  preview.timer = setTimeout(() => {
    sendFrame(uid, preview.width, preview.height);
    schedule(uid, preview);
  }, preview.next - now);
}

function setPreview({ uid, width, height, rate }) {
  const old = previews.get(uid);
  if (old) clearTimeout(old.timer);
  previews.delete(uid);
  const source = sources.get(uid);
  if (!source || !source.width || !(rate > 0) || !(width > 0) || !(height > 0)) return;
  const preview = {
    width: Math.min(width, source.width) | 0,
    height: Math.min(height, source.height) | 0,
    period: 1000 / Math.min(rate, 30),
    next: performance.now(),
  };
  previews.set(uid, preview);
  schedule(uid, preview);
}

function setLevels(on) {
  clearInterval(levelTimer);
  levelTimer = null;
  if (!on) return;
  levelTimer = setInterval(() => {
    for (const source of sources.values()) {
      if (source.type !== 'wasapi' && source.type !== 'mfce_audio') continue;
      const peaks = addon.getPreview(source.id);
      if (peaks) send({ type: 'levels', uid: source.id, peaks });
    }
  }, LEVEL_INTERVAL_MS);
}

process.on('message', (message) => {
  switch (message.type) {
    case 'preview': setPreview(message); break;
    case 'levels': setLevels(message.on); break;
    case 'start': addon.startCapture(message.uid, message.filename); break;
    case 'stop': addon.stopCapture(message.uid); break;
    default: break;
  }
});
// The server is gone: nothing is left to serve.
process.on('disconnect', () => process.exit(0));
// Ctrl+C reaches the whole process group; the server ends this process once it has stopped serving.
process.on('SIGINT', () => {});

addon.setCallback((event) => {
  if (event.type === 'new source') sources.set(event.source.id, event.source);
  send({ type: 'event', event });
});
addon.initialize();
send({ type: 'ready' });
