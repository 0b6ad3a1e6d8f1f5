#!/usr/bin/env node
'use strict';
// CPU and latency of one audio endpoint while it records 48 kHz stereo, against FFmpeg recording
// the same sink's monitor to AAC at 192 kbit/s in the same run.
//
// CPU of the add-on is counted per thread (/proc/<pid>/task/<tid>/stat): the endpoint's capture
// thread (which also runs the encoder), its silence thread and libpulse's main-loop thread, which
// does the server I/O for both. Those three are the threads made right after libpulse's
// "threaded-ml" thread appears, in tid order. FFmpeg's CPU is the whole process (user + system).
// Latency: a low-latency pacat is already playing silence; the time from writing the first tone
// bytes to it until getPreview first shows a peak above 0.1 (so it includes pacat's 10 ms buffer).
//   node bench/audio.js [seconds=30]
const { execFileSync, spawnSync } = require('child_process');
const fs = require('fs');
const os = require('os');
const path = require('path');
const { startDesktop } = require('../scripts/desktop');
const { runAddon } = require('../test/js/addon');

const seconds = Number(process.argv[2] || 30);

async function main() {
  const desktop = await startDesktop({
    sinks: [{ name: 'bench', description: 'Bench Speaker', rate: 48000, channels: 2, default: true }],
  });
  const dir = fs.mkdtempSync(path.join(os.tmpdir(), 'tavio-audio-bench-'));
  try {
    const env = { ...process.env, ...desktop.env };
    const tone = path.join(dir, 'tone.wav');
    execFileSync('sox', ['-n', '-r', '48000', '-c', '2', '-b', '16', tone, 'synth', String(seconds + 15), 'sine', '440', 'vol', '0.5']);

    const clip = path.join(dir, 'addon.mp4');
    const { reports, code, stdout, stderr } = await runAddon(`
      const fs = require('fs');
      const { spawn } = require('child_process');
      const ticks = (tid) => {
        const stat = fs.readFileSync('/proc/self/task/' + tid + '/stat', 'utf8');
        const fields = stat.slice(stat.lastIndexOf(')') + 2).split(' ');
        return Number(fields[11]) + Number(fields[12]);
      };
      const tasks = () => fs.readdirSync('/proc/self/task').map(Number).sort((a, b) => a - b);
      const name = (tid) => fs.readFileSync('/proc/self/task/' + tid + '/comm', 'utf8').trim();
      const before = new Set(tasks());
      addon.initialize();
      const made = tasks().filter((t) => !before.has(t));
      const loop = made.findIndex((t) => name(t) === 'threaded-ml');
      const audio = made.slice(loop, loop + 3);
      const uid = events.find((e) => e.source.type === 'wasapi').source.id;

      // Latency of the preview.
      const player = spawn('pacat', ['--device=bench', '--latency-msec=10', '--format=s16le', '--rate=48000', '--channels=2'],
        { stdio: ['pipe', 'ignore', 'ignore'] });
      const silence = Buffer.alloc(48000 * 4 / 10);
      for (let i = 0; i < 10; i++) { player.stdin.write(silence); await sleep(100); }
      const wave = Buffer.alloc(48000 * 4);
      for (let i = 0; i < 48000; i++) {
        const v = Math.round(16383 * Math.sin(2 * Math.PI * 440 * i / 48000));
        wave.writeInt16LE(v, 4 * i); wave.writeInt16LE(v, 4 * i + 2);
      }
      const written = process.hrtime.bigint();
      player.stdin.write(wave);
      let latency = null;
      while (process.hrtime.bigint() - written < 2000000000n) {
        if (addon.getPreview(uid).left > 0.1) { latency = Number(process.hrtime.bigint() - written) / 1e6; break; }
        await new Promise((r) => setImmediate(r));
      }
      player.stdin.end();
      await sleep(200);

      const tonePlayer = spawn('paplay', ['--device=bench', ${JSON.stringify(tone)}], { stdio: 'ignore' });
      await sleep(500);
      const start = audio.map(ticks);
      const wallStart = Date.now();
      addon.startCapture(uid, ${JSON.stringify(clip)});
      await sleep(${seconds * 1000});
      addon.stopCapture(uid);
      const end = audio.map(ticks);
      const wall = (Date.now() - wallStart) / 1000;
      await sleep(300);
      tonePlayer.kill();
      report({ latency, wall, names: audio.map(name), ticks: end.map((e, i) => e - start[i]) });`,
    { env: desktop.env, timeoutMs: (seconds + 60) * 1000 });
    if (code !== 0 || !reports.length) throw new Error(`add-on run failed (${code}): ${stdout}\n${stderr}`);
    const addonRun = reports[0];

    // FFmpeg on the same sink while the same tone plays.
    const player = require('child_process').spawn('paplay', ['--device=bench', tone], { env, stdio: 'ignore' });
    await new Promise((r) => setTimeout(r, 500));
    const out = path.join(dir, 'ffmpeg.mp4');
    const timed = spawnSync('/usr/bin/time', ['-f', '%U %S %e', 'ffmpeg', '-v', 'error', '-y', '-f', 'pulse', '-i', 'bench.monitor',
      '-t', String(seconds), '-c:a', 'aac', '-b:a', '192k', out], { env, encoding: 'utf8' });
    player.kill();
    const [user, system, elapsed] = timed.stderr.trim().split('\n').pop().split(' ').map(Number);

    const addonCpu = addonRun.ticks.reduce((a, b) => a + b, 0) / 100;
    const ffmpegCpu = user + system;
    const perThread = addonRun.names.map((n, i) => `${n}:${(addonRun.ticks[i] / 100).toFixed(2)}s`).join(' ');
    console.log(`recorded ${addonRun.wall.toFixed(1)} s of 48 kHz stereo`);
    console.log(`add-on  CPU ${addonCpu.toFixed(2)} s (${(100 * addonCpu / addonRun.wall).toFixed(2)} % of a core) [${perThread}]`);
    console.log(`ffmpeg  CPU ${ffmpegCpu.toFixed(2)} s (${(100 * ffmpegCpu / elapsed).toFixed(2)} % of a core, ${elapsed} s)`);
    console.log(`ratio add-on / ffmpeg: ${(addonCpu / addonRun.wall / (ffmpegCpu / elapsed)).toFixed(2)} (target <= 1)`);
    console.log(`preview latency, tone written to first peak: ${addonRun.latency === null ? 'none within 2 s' : addonRun.latency.toFixed(1) + ' ms'} (target < 50 ms)`);
  } finally {
    desktop.stop();
    fs.rmSync(dir, { recursive: true, force: true });
  }
}

main().catch((e) => { console.error(e); process.exit(1); });
