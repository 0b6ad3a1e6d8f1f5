#!/usr/bin/env node
'use strict';
// Finds every capture device, saves a preview picture of each display and camera, records a
// few seconds of every source into MP4 files and prints the events. Without DISPLAY or
// PULSE_SERVER in the environment it starts a private virtual desktop with a moving picture
// and a tone playing, and (unless TAVIO_TEST_CAMERAS says otherwise) two test cameras, one of
// them sending H.264. Files go to
// ./out (or the folder named as the first argument).
const { execFileSync, spawnSync } = require('child_process');
const fs = require('fs');
const path = require('path');
const { startDesktop, startAnimation, playTone } = require('../scripts/desktop');

const outDir = path.resolve(process.argv[2] || 'out');
const seconds = Number(process.env.DEMO_SECONDS || 4);
const sleep = (ms) => new Promise((resolve) => setTimeout(resolve, ms));

function savePicture(pixels, width, height, file) {
  // The preview is RGBA rows, top to bottom: ffmpeg turns it into a PNG.
  execFileSync('ffmpeg', ['-loglevel', 'error', '-y', '-f', 'rawvideo', '-pix_fmt', 'rgba', '-s', `${width}x${height}`,
    '-i', '-', '-frames:v', '1', file], { input: Buffer.from(pixels.buffer) });
}

function describeFile(file) {
  const probe = spawnSync('ffprobe', ['-v', 'error', '-show_entries',
    'stream=codec_name,profile,width,height,r_frame_rate,sample_rate,channels:format=duration,bit_rate',
    '-of', 'json', file], { encoding: 'utf8' });
  if (probe.status !== 0) return `unreadable (${probe.stderr.trim()})`;
  const info = JSON.parse(probe.stdout);
  const s = info.streams[0] || {};
  const what = s.width ? `${s.codec_name} ${s.profile} ${s.width}x${s.height} ${s.r_frame_rate} fps`
    : `${s.codec_name} ${s.sample_rate} Hz ${s.channels} ch`;
  return `${what}, ${Number(info.format.duration).toFixed(2)} s, ${Math.round(info.format.bit_rate / 1000)} kbit/s`;
}

async function main() {
  fs.mkdirSync(outDir, { recursive: true });
  const givenDisplay = Boolean(process.env.DISPLAY);
  const givenSound = Boolean(process.env.PULSE_SERVER);
  const desktop = await startDesktop({ private: false });
  Object.assign(process.env, desktop.env);
  const helpers = [];
  if (!givenDisplay) {
    helpers.push(startAnimation(desktop.env, { x: 200, y: 150 }));
    console.log(`demo: private display ${desktop.env.DISPLAY} with a moving picture`);
    if (process.env.TAVIO_TEST_CAMERAS === undefined) {
      process.env.TAVIO_TEST_CAMERAS =
        'Demo Test Camera=testsrc2=size=640x480:rate=30;Demo H.264 Camera=h264:smptebars=size=640x360:rate=30';
      console.log('demo: test cameras "Demo Test Camera" (an FFmpeg test pattern) and "Demo H.264 Camera"'
        + ' (colour bars sent as H.264, recorded as sent)');
    }
  }
  if (!givenSound) {
    helpers.push(playTone(desktop.env, { frequency: 440 }));
    console.log(`demo: private sound server ${desktop.env.PULSE_SERVER} with a 440 Hz tone playing`);
  }
  const finish = (code) => {
    helpers.forEach((h) => h.kill());
    desktop.stopAfterExit();
    process.exit(code);
  };
  await sleep(1000);

  const addon = require('..');
  const sources = [];
  addon.setCallback((event) => {
    console.log('event', JSON.stringify(event));
    if (event.type === 'new source') sources.push(event.source);
  });
  addon.initialize();
  if (sources.length === 0) console.log('demo: no capture device found');
  await sleep(1000);

  for (const source of sources) {
    if (source.type === 'dxgi' || source.type === 'mfce_video') {
      const width = Math.max(1, Math.round(source.width / 4));
      const height = Math.max(1, Math.round(source.height / 4));
      const pixels = addon.getPreview(source.id, width, height);
      if (!pixels) continue;
      const file = path.join(outDir, `preview-${source.id}-${source.type}.png`);
      savePicture(pixels, width, height, file);
      console.log(`demo: preview of ${source.id} "${source.name}" saved as ${file}`);
    }
  }

  const clips = sources.map((s) => ({ source: s, file: path.join(outDir, `clip-${s.id}-${s.type}.mp4`) }));
  for (const clip of clips) addon.startCapture(clip.source.id, clip.file);
  for (let i = 0; i < seconds; i++) {
    await sleep(1000);
    for (const s of sources.filter((x) => x.type === 'wasapi' || x.type === 'mfce_audio')) {
      const peaks = addon.getPreview(s.id);
      console.log(`demo: peaks of ${s.id} "${s.name}": left ${peaks.left.toFixed(3)} right ${peaks.right.toFixed(3)}`);
    }
  }
  for (const clip of clips) addon.stopCapture(clip.source.id);
  await sleep(2000);  // the recorders finish their files after their next frame or packet

  for (const clip of clips) {
    const state = fs.existsSync(clip.file) ? describeFile(clip.file) : 'not written';
    console.log(`demo: ${clip.file}: ${state}`);
  }
  finish(0);
}

main().catch((error) => {
  console.error(error);
  process.exit(1);
});
