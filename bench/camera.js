'use strict';
// A 1280x720 30 fps test camera previewed and recorded through the add-on, against ffmpeg
// recording the same frames: the same lavfi picture converted to YUY2, as the add-on's test camera
// delivers it (a webcam's format), encoded with libx264 at the settings the sink writer uses for
// a camera recording (superfast, zerolatency, Baseline since the record type names no profile,
// the estimated 9216000 bit/s with a one-second buffer, a key frame every 2 s, no B-frames), for
// the same number of frames, in the same run.
//
// CPU: the camera's own threads, read per thread from /proc/self/task: the device reader
// (tavio-reader, which also runs the lavfi graph, as ffmpeg's input does) and the engine thread
// (tavio-engine, which decodes, converts for the preview and encodes; libx264's threads inherit
// its name). The rest of the process (the desktop's other sources, Node) is left out. For ffmpeg,
// the whole process. Printed:
//   CPU per recorded frame, ours / ffmpeg's, with the preview (which runs while recording) and
//   with the preview's cost below taken out;
//   the preview's cost: the camera's threads while only previewing, against ffmpeg reading the
//   same source into the null muxer (its cost of capture alone), as a share of a core.
//
// Latency: a second test camera draws the wall clock into its pictures (bench/clockcamera.js);
// polling getPreview, the picture's time is compared with the clock, while previewing and while
// recording.
//   node bench/camera.js [seconds]
const { spawnSync } = require('child_process');
const fs = require('fs');
const os = require('os');
const path = require('path');
const { startDesktop } = require('../scripts/desktop');
const { runAddon } = require('../test/js/addon');
const { CLOCK, CLOCK_READER } = require('./clockcamera');
const { ffmpegCpu } = require('./ffmpegcpu');

const seconds = Number(process.argv[2] || 20);
const SOURCE = 'testsrc2=size=1280x720:rate=30';
const DELIVERED = `${SOURCE},format=yuyv422`;  // what the test camera hands the engine
const BITRATE = 9216000;  // 1280 / 3 * 720 * 30, the estimate the capture manager asks for
const X264 = ['-c:v', 'libx264', '-preset', 'superfast', '-tune', 'zerolatency', '-profile:v', 'baseline',
  '-b:v', String(BITRATE), '-maxrate', String(BITRATE), '-bufsize', String(BITRATE), '-g', '60', '-bf', '0',
  '-pix_fmt', 'yuv420p'];
function stream(file) {
  const r = spawnSync('ffprobe', ['-v', 'error', '-select_streams', 'v:0', '-count_packets', '-show_entries',
    'stream=nb_read_packets,profile,bit_rate,width,height', '-of', 'json', file], { encoding: 'utf8' });
  return JSON.parse(r.stdout).streams[0];
}

const CHILD_HELPERS = `
const fs = require('fs');
const ticks = ${Number(spawnSync('getconf', ['CLK_TCK'], { encoding: 'utf8' }).stdout) || 100};
const cpu = () => {
  const stat = fs.readFileSync('/proc/self/stat', 'utf8');
  const fields = stat.slice(stat.lastIndexOf(')') + 2).split(' ');  // fields from the third (state) on
  return (Number(fields[11]) + Number(fields[12])) / ticks;  // utime, stime
};
const wall = () => (performance.timeOrigin + performance.now()) / 1000;
// CPU seconds of the threads with the given names.
const threadsCpu = (names) => {
  let total = 0;
  for (const tid of fs.readdirSync('/proc/self/task')) {
    try {
      const stat = fs.readFileSync('/proc/self/task/' + tid + '/stat', 'utf8');
      const close = stat.lastIndexOf(')');
      if (!names.includes(stat.slice(stat.indexOf('(') + 1, close))) continue;
      const fields = stat.slice(close + 2).split(' ');
      total += (Number(fields[11]) + Number(fields[12])) / ticks;
    } catch (e) { /* the thread ended meanwhile */ }
  }
  return total;
};
const CAMERA_THREADS = ['tavio-engine', 'tavio-reader'];
`;

function stats(values) {
  const sorted = [...values].sort((a, b) => a - b);
  const at = (q) => sorted[Math.min(sorted.length - 1, Math.floor(q * sorted.length))];
  const mean = values.reduce((s, v) => s + v, 0) / values.length;
  return `mean ${mean.toFixed(1)} ms, median ${at(0.5).toFixed(1)}, p90 ${at(0.9).toFixed(1)}, ` +
    `min ${sorted[0].toFixed(1)}, max ${sorted[sorted.length - 1].toFixed(1)} (${values.length} new frames seen)`;
}

async function main() {
  const dir = fs.mkdtempSync(path.join(os.tmpdir(), 'tavio-bench-camera-'));
  const desktop = await startDesktop({ width: 1280, height: 720, microphone: null });
  try {
    // CPU per recorded frame.
    const ours = path.join(dir, 'ours.mp4');
    const cpuRun = await runAddon(`${CHILD_HELPERS}
      addon.initialize();
      const camera = events.find((e) => e.type === 'new source' && e.source.type === 'mfce_video').source;
      await sleep(3000);  // the engine has opened the device and previews
      let c0 = threadsCpu(CAMERA_THREADS), t0 = wall();
      await sleep(${seconds * 1000});
      const idleCpu = threadsCpu(CAMERA_THREADS) - c0, idleTime = wall() - t0;
      c0 = threadsCpu(CAMERA_THREADS); t0 = wall();
      addon.startCapture(camera.id, ${JSON.stringify(ours)});
      await sleep(${seconds * 1000});
      // Before the stop: libx264's threads end with the file.
      const recordCpu = threadsCpu(CAMERA_THREADS) - c0, recordTime = wall() - t0;
      addon.stopCapture(camera.id);
      await sleep(1000);  // the file is finished on the engine's thread
      report({ idleCpu, idleTime, recordCpu, recordTime });
    `, { env: { ...desktop.env, TAVIO_TEST_CAMERAS: `Bench Camera=${SOURCE}` }, timeoutMs: (2 * seconds + 60) * 1000 });
    if (!cpuRun.reports.length) throw new Error(`add-on run failed: ${cpuRun.stderr}`);
    const { idleCpu, idleTime, recordCpu, recordTime } = cpuRun.reports[0];
    const ourStream = stream(ours);
    const frames = Number(ourStream.nb_read_packets);
    const idleRate = idleCpu / idleTime;

    const theirs = path.join(dir, 'ffmpeg.mp4');
    const input = ['-re', '-f', 'lavfi', '-i', DELIVERED, '-frames:v', String(frames)];
    const theirCpu = ffmpegCpu(dir, [...input, ...X264, theirs]);
    const theirBase = ffmpegCpu(dir, [...input, '-f', 'null', '-']);
    const theirStream = stream(theirs);
    const theirFrames = Number(theirStream.nb_read_packets);
    const baseRate = theirBase / (frames / 30);

    const ms = (cpu, n) => (cpu / n * 1000).toFixed(2);
    console.log(`tavio_capture: ${frames} frames ${ourStream.width}x${ourStream.height} in ${recordTime.toFixed(1)} s, ` +
      `profile ${ourStream.profile}, ${ourStream.bit_rate} bit/s`);
    console.log(`  camera threads previewing only: ${(idleRate * 100).toFixed(1)} % of a core; ` +
      `recording: ${recordCpu.toFixed(2)} CPU s, ${ms(recordCpu, frames)} CPU ms/frame`);
    console.log(`ffmpeg libx264: ${theirFrames} frames, profile ${theirStream.profile}, ${theirStream.bit_rate} bit/s, ` +
      `${theirCpu.toFixed(2)} CPU s, ${ms(theirCpu, theirFrames)} CPU ms/frame; the source alone: ` +
      `${(baseRate * 100).toFixed(1)} % of a core`);
    console.log(`CPU per recorded frame, ours / ffmpeg: ${((recordCpu / frames) / (theirCpu / theirFrames)).toFixed(2)} ` +
      '(target <= 1.0)');
    console.log(`preview on top of capture alone: ${((idleRate - baseRate) * 100).toFixed(1)} % of a core (target <= 5)`);
    // The preview runs while recording too; the recording's own cost is what is left without it.
    const recordOnly = recordCpu - (idleRate - baseRate) * recordTime;
    console.log(`CPU per recorded frame, the preview on top taken out, ours / ffmpeg: ` +
      `${((recordOnly / frames) / (theirCpu / theirFrames)).toFixed(2)}`);

    // Preview latency.
    const latencyFile = path.join(dir, 'latency.mp4');
    const lat = await runAddon(`${CHILD_HELPERS}${CLOCK_READER}
      addon.initialize();
      const camera = events.find((e) => e.type === 'new source' && e.source.type === 'mfce_video').source;
      await sleep(3000);
      const previewing = await measureClock(camera.id, ${seconds * 500});
      addon.startCapture(camera.id, ${JSON.stringify(latencyFile)});
      await sleep(1000);
      const recording = await measureClock(camera.id, ${seconds * 500});
      addon.stopCapture(camera.id);
      report({ previewing, recording });
    `, { env: { ...desktop.env, TAVIO_TEST_CAMERAS: `Clock Camera=${CLOCK}` }, timeoutMs: (seconds + 60) * 1000 });
    if (!lat.reports.length) throw new Error(`add-on run failed: ${lat.stderr}`);
    const { previewing, recording } = lat.reports[0];
    // The first poll that sees a frame comes up to one poll interval (about 1 ms) after it is there.
    console.log(`preview latency, frame leaves the source -> seen through getPreview (1280x720 camera, 320x180 preview):`);
    console.log(`  previewing: ${stats(previewing)}`);
    console.log(`  recording:  ${stats(recording)}`);
  } finally {
    desktop.stop();
    fs.rmSync(dir, { recursive: true, force: true });
  }
}

main().catch((e) => { console.error(e); process.exit(1); });
