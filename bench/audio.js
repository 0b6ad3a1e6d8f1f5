#!/usr/bin/env node
'use strict';
// CPU and latency of one audio endpoint while it records 48 kHz stereo, against FFmpeg recording
// the same sink's monitor to AAC at 192 kbit/s in the same run.
//
// CPU is read per thread (/proc/<pid>/task/<tid>/stat) over the recording. Our threads, by name:
//   tavio-pulse    libpulse's main loop: all server I/O of the loopback and the silence stream;
//   tavio-silence  the source's silence thread (keeps the sink running; FFmpeg has no such thing);
//   tavio-capture  the capture thread, which runs the encoder (conversion, AAC, MP4) as well.
// (Other libraries start PulseAudio loops of their own during initialize, so position in tid
// order is no guide.) FFmpeg is the whole process (user + system: its pulse thread, AAC encoder and muxer, and
// its start-up). Two ratios are printed, both per second of wall time:
//   all three threads / FFmpeg      what one recording endpoint costs in total;
//   capture + main loop / FFmpeg    the same work FFmpeg does (read the monitor, encode, mux).
// The capture thread's CPU is also measured for a few seconds with preview on and recording
// off, so the encoder's share shows. Voluntary context switches count the wake-ups per thread.
// A floor is printed as well: FFmpeg's AAC encoder on the same tone from a file (the encoder both
// sides use) plus a bare loop of 5 ms sleeps (bench/tools/sleeploop.cc, the capture loop's wait
// while its buffer is empty); a recording that polls cannot cost less than the two together.
//
// Latency: bench/tools/tonestart.cc (built here with g++) plays silence into the sink through a
// 5 ms stream, then tones separated by silence. For each tone it prints the monotonic time at
// which it wrote the first tone bytes and the time the sink plays them (write time plus the
// stream's latency from timing information fetched just before the write). The add-on's child
// polls getPreview every millisecond on the same clock (process.hrtime is CLOCK_MONOTONIC) and
// notes each rise of the left peak from below 0.01 to above 0.1. Each tone pairs with the first
// rise after its write. "from write" is an upper bound (it includes the tool's own few ms of
// queued silence); "from play" is what a listener would call the tone's start. A null sink mixes
// ahead of its nominal play time, so "from play" can come out below the polling step.
//   node bench/audio.js [seconds=30]
const { execFileSync, spawnSync } = require('child_process');
const fs = require('fs');
const os = require('os');
const path = require('path');
const { startDesktop } = require('../scripts/desktop');
const { runAddon, root } = require('../test/js/addon');

const seconds = Number(process.argv[2] || 30);
const idleSeconds = 5;
const tones = 8;

const median = (list) => {
  const s = [...list].sort((a, b) => a - b);
  return s.length ? s[Math.floor(s.length / 2)] : NaN;
};

async function main() {
  const desktop = await startDesktop({
    sinks: [{ name: 'bench', description: 'Bench Speaker', rate: 48000, channels: 2, default: true }],
  });
  const dir = fs.mkdtempSync(path.join(os.tmpdir(), 'tavio-audio-bench-'));
  try {
    const env = { ...process.env, ...desktop.env };
    const tone = path.join(dir, 'tone.wav');
    execFileSync('sox', ['-n', '-r', '48000', '-c', '2', '-b', '16', tone, 'synth', String(seconds + 15), 'sine', '440', 'vol', '0.5']);
    const tonestart = path.join(dir, 'tonestart');
    execFileSync('g++', ['-O2', '-o', tonestart, path.join(root, 'bench/tools/tonestart.cc'), '-lpulse']);
    const sleeploop = path.join(dir, 'sleeploop');
    execFileSync('g++', ['-O2', '-o', sleeploop, path.join(root, 'bench/tools/sleeploop.cc')]);

    const clip = path.join(dir, 'addon.mp4');
    const { reports, code, stdout, stderr } = await runAddon(`
      const fs = require('fs');
      const { spawn } = require('child_process');
      const ticks = (tid) => {
        const stat = fs.readFileSync('/proc/self/task/' + tid + '/stat', 'utf8');
        const fields = stat.slice(stat.lastIndexOf(')') + 2).split(' ');
        return Number(fields[11]) + Number(fields[12]);
      };
      const wakeups = (tid) => Number(/voluntary_ctxt_switches:\\s+(\\d+)/.exec(
        fs.readFileSync('/proc/self/task/' + tid + '/status', 'utf8'))[1]);
      const tasks = () => fs.readdirSync('/proc/self/task').map(Number).sort((a, b) => a - b);
      const name = (tid) => fs.readFileSync('/proc/self/task/' + tid + '/comm', 'utf8').trim();
      addon.initialize();
      const audio = ['tavio-pulse', 'tavio-silence', 'tavio-capture'].map((n) => {
        const found = tasks().filter((t) => name(t) === n);
        if (found.length !== 1) throw new Error(found.length + ' threads named ' + n);
        return found[0];
      });
      const uid = events.find((e) => e.source.type === 'wasapi').source.id;
      await sleep(500);

      // Latency: rises of the peak against the tool's tone times.
      const tool = spawn(${JSON.stringify(tonestart)}, ['bench', '${tones}', '400', '200'], { stdio: ['ignore', 'pipe', 'inherit'] });
      let text = '';
      let ended = false;
      tool.stdout.on('data', (d) => { text += d; });
      tool.on('exit', () => { ended = true; });
      const rises = [];
      let quiet = false;
      while (!ended) {
        const left = addon.getPreview(uid).left;
        if (left < 0.01) quiet = true;
        else if (quiet && left > 0.1) { rises.push(process.hrtime.bigint()); quiet = false; }
        await sleep(1);
      }
      const toneTimes = text.split('\\n').filter((l) => l.startsWith('tone ')).map((l) => l.split(' ').slice(1).map(BigInt));
      const latency = toneTimes.map(([written, played]) => {
        const rise = rises.find((r) => r > written);
        return rise === undefined ? null : { write: Number(rise - written) / 1e6, play: Number(rise - played) / 1e6 };
      });

      const tonePlayer = spawn('paplay', ['--device=bench', ${JSON.stringify(tone)}], { stdio: 'ignore' });
      await sleep(500);
      const idleStart = audio.map(ticks);
      await sleep(${idleSeconds * 1000});
      const idle = audio.map(ticks).map((e, i) => e - idleStart[i]);
      const start = audio.map(ticks);
      const startWakeups = audio.map(wakeups);
      const wallStart = Date.now();
      addon.startCapture(uid, ${JSON.stringify(clip)});
      await sleep(${seconds * 1000});
      addon.stopCapture(uid);
      const end = audio.map(ticks);
      const endWakeups = audio.map(wakeups);
      const wall = (Date.now() - wallStart) / 1000;
      await sleep(300);
      tonePlayer.kill();
      report({ latency, wall, idle, names: audio.map(name), ticks: end.map((e, i) => e - start[i]),
        wakeups: endWakeups.map((e, i) => e - startWakeups[i]) });`,
    { env: desktop.env, timeoutMs: (seconds + 90) * 1000 });
    if (code !== 0 || !reports.length) throw new Error(`add-on run failed (${code}): ${stdout}\n${stderr}`);
    const addonRun = reports[0];
    const recorded = spawnSync('ffprobe', ['-v', 'error', '-show_entries', 'format=duration', '-of', 'csv=p=0', clip], { encoding: 'utf8' });

    // FFmpeg on the same sink while the same tone plays.
    const player = require('child_process').spawn('paplay', ['--device=bench', tone], { env, stdio: 'ignore' });
    await new Promise((r) => setTimeout(r, 500));
    const out = path.join(dir, 'ffmpeg.mp4');
    const timed = spawnSync('/usr/bin/time', ['-f', '%U %S %e %w', 'ffmpeg', '-v', 'error', '-y', '-f', 'pulse', '-i', 'bench.monitor',
      '-t', String(seconds), '-c:a', 'aac', '-b:a', '192k', out], { env, encoding: 'utf8' });
    player.kill();
    const [user, system, elapsed, ffmpegWakeups] = timed.stderr.trim().split('\n').pop().split(' ').map(Number);

    // What no recording here can go below: the encoder's own work (FFmpeg's AAC encoder, which
    // both sides use, on the same tone read from a file, less FFmpeg's start-up measured on a
    // tenth of a second of it) and the cost of polling every 5 ms.
    const cpuOf = (args) => {
      const run = spawnSync('/usr/bin/time', ['-f', '%U %S', 'ffmpeg', '-v', 'error', '-y', ...args], { encoding: 'utf8' });
      return run.stderr.trim().split('\n').pop().split(' ').map(Number).reduce((a, b) => a + b, 0);
    };
    const aacArgs = (length) => ['-t', String(length), '-i', tone, '-c:a', 'aac', '-b:a', '192k', path.join(dir, 'file.mp4')];
    const aacOnly = Math.max(0, cpuOf(aacArgs(seconds)) - cpuOf(aacArgs(0.1)));
    const [polls, pollCpu, pollWall] = execFileSync(sleeploop, ['5'], { encoding: 'utf8' }).trim().split(' ').map(Number);

    // Threads in tid order: main loop, silence, capture.
    const cpu = addonRun.ticks.map((t) => t / 100);
    const [mainLoop, silence, capture] = cpu;
    const total = mainLoop + silence + capture;
    const ffmpegCpu = user + system;
    const rate = (c) => c / addonRun.wall;
    const ffmpegRate = ffmpegCpu / elapsed;
    const labels = ['main loop', 'silence', 'capture'];
    const perThread = labels.map((n, i) => `${n} ${cpu[i].toFixed(2)} s/${addonRun.wakeups[i]} wake-ups`).join(', ');
    console.log(`load average ${os.loadavg().map((l) => l.toFixed(2)).join(' ')}`);
    console.log(`recorded ${addonRun.wall.toFixed(1)} s of 48 kHz stereo (file ${Number(recorded.stdout).toFixed(2)} s)`);
    // A capture thread that failed shows up as a warning line; its CPU figures would mean nothing.
    const warnings = stdout.split('\n').filter((l) => l.includes('Warning'));
    if (warnings.length) console.log(`add-on warnings:\n${warnings.join('\n')}`);
    console.log(`add-on  CPU ${total.toFixed(2)} s (${(100 * rate(total)).toFixed(2)} % of a core) [${perThread}]`);
    console.log(`        capture thread with preview only: ${(100 * addonRun.idle[2] / 100 / idleSeconds).toFixed(2)} % of a core ` +
      `(recording: ${(100 * rate(capture)).toFixed(2)} %)`);
    console.log(`ffmpeg  CPU ${ffmpegCpu.toFixed(2)} s (${(100 * ffmpegRate).toFixed(2)} % of a core, ${elapsed} s, ${ffmpegWakeups} wake-ups)`);
    console.log(`ratio all three threads / ffmpeg: ${(rate(total) / ffmpegRate).toFixed(2)} (target <= 1)`);
    console.log(`ratio capture + main loop / ffmpeg: ${(rate(capture + mainLoop) / ffmpegRate).toFixed(2)}`);
    const aacRate = aacOnly / seconds;
    const pollRate = pollCpu / pollWall;
    console.log(`floor: AAC alone ${(100 * aacRate).toFixed(2)} % of a core (${aacOnly.toFixed(2)} s for ${seconds} s from a file), ` +
      `a bare 5 ms polling loop ${(100 * pollRate).toFixed(2)} % (${(1e6 * pollCpu / polls).toFixed(0)} us a wake-up); ` +
      `their sum / ffmpeg: ${((aacRate + pollRate) / ffmpegRate).toFixed(2)}`);
    const seen = addonRun.latency.filter((l) => l);
    const list = (key) => seen.map((l) => l[key].toFixed(1)).join(' ');
    console.log(`latency tone -> first peak, ${seen.length}/${addonRun.latency.length} tones seen (target < 50 ms):`);
    console.log(`  from write: median ${median(seen.map((l) => l.write)).toFixed(1)} ms [${list('write')}]`);
    console.log(`  from play:  median ${median(seen.map((l) => l.play)).toFixed(1)} ms [${list('play')}]`);
  } finally {
    desktop.stop();
    fs.rmSync(dir, { recursive: true, force: true });
  }
}

main().catch((e) => { console.error(e); process.exit(1); });
