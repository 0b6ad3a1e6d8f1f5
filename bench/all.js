'use strict';
// Every kind of source recording at once, as a host's "record all" does, against four ffmpeg
// processes recording the same sources with the same settings, in the same run:
//   a 1920x1080 display changing at 60 Hz (x11grab at the clips' 30 fps, libx264 superfast,
//     zerolatency, Main, 10485760 bit/s);
//   a 1280x720 30 fps test camera sending YUY2 (the same lavfi picture converted to YUY2, libx264
//     superfast, zerolatency, Baseline, 9216000 bit/s, a key frame every 2 s);
//   the speakers with a tone playing (the sink's monitor, AAC);
//   the microphone (the same PulseAudio source, AAC at the bit rate our clip has).
// The add-on's process previews as a host's window would meanwhile: both pictures 15 times a
// second at 640x360, both peak meters 10 times a second. Its CPU is the whole process over the
// recording (utime + stime of /proc/self/stat); ffmpeg's is the four processes' together (each
// one's `times`). Per source, the add-on's threads (by name) are set against the ffmpeg process of
// that source. Frames and durations come from ffprobe; resident memory is read at 10 s and at the
// end.
// A floor is printed as well: the four encoders alone (libx264 twice, AAC twice) on the same sources
// with the same settings, each fed raw pictures or samples through a pipe by an ffmpeg that grabs
// and converts them; only the encoding processes are counted, pipe reads included. Both sides pay
// this much; what is left over is capture, conversion, previews and file writing.
//   node bench/all.js [seconds=60]
const { spawn, spawnSync, execFileSync } = require('child_process');
const fs = require('fs');
const os = require('os');
const path = require('path');
const { startDesktop, playTone } = require('../scripts/desktop');
const { distinct } = require('./pictures');
const { runFfmpeg } = require('./ffmpegcpu');
const { runAddon, root } = require('../test/js/addon');

const seconds = Number(process.argv[2] || 60);
const CAMERA = 'testsrc2=size=1280x720:rate=30';
const DISPLAY_X264 = ['-c:v', 'libx264', '-preset', 'superfast', '-tune', 'zerolatency', '-profile:v', 'main',
  '-b:v', '10485760', '-pix_fmt', 'yuv420p'];
const CAMERA_X264 = ['-c:v', 'libx264', '-preset', 'superfast', '-tune', 'zerolatency', '-profile:v', 'baseline',
  '-b:v', '9216000', '-maxrate', '9216000', '-bufsize', '9216000', '-g', '60', '-bf', '0', '-pix_fmt', 'yuv420p'];

function probe(file) {
  const r = spawnSync('ffprobe', ['-v', 'error', '-count_packets', '-show_entries',
    'stream=codec_type,nb_read_packets,bit_rate:format=duration', '-of', 'json', file], { encoding: 'utf8' });
  if (r.status !== 0) return { packets: 0, duration: 0, bitRate: 0 };
  const info = JSON.parse(r.stdout);
  const s = info.streams[0];
  return { packets: Number(s.nb_read_packets), duration: Number(info.format.duration), bitRate: Number(s.bit_rate) };
}

async function main() {
  const dir = fs.mkdtempSync(path.join(os.tmpdir(), 'tavio-bench-all-'));
  const xpattern = path.join(dir, 'xpattern');
  execFileSync('g++', ['-O2', '-o', xpattern, path.join(root, 'test/tools/xpattern.cc'), '-lxcb']);
  const desktop = await startDesktop({ width: 1920, height: 1080 });
  const env = { ...process.env, ...desktop.env };
  const animation = spawn(xpattern, ['0', '0', '1920', '1080', '60'], { env, stdio: 'ignore' });
  const tone = playTone(desktop.env);
  const ours = {
    display: path.join(dir, 'display.mp4'), camera: path.join(dir, 'camera.mp4'),
    speakers: path.join(dir, 'speakers.mp4'), microphone: path.join(dir, 'microphone.mp4'),
  };
  try {
    const run = await runAddon(`
      const fs = require('fs');
      const ticks = ${Number(spawnSync('getconf', ['CLK_TCK'], { encoding: 'utf8' }).stdout) || 100};
      const cpu = () => {
        const stat = fs.readFileSync('/proc/self/stat', 'utf8');
        const fields = stat.slice(stat.lastIndexOf(')') + 2).split(' ');
        return (Number(fields[11]) + Number(fields[12])) / ticks;
      };
      // CPU seconds by thread name, summed over the live threads.
      const byThread = () => {
        const all = {};
        for (const tid of fs.readdirSync('/proc/self/task')) {
          try {
            const stat = fs.readFileSync('/proc/self/task/' + tid + '/stat', 'utf8');
            const close = stat.lastIndexOf(')');
            const fields = stat.slice(close + 2).split(' ');
            const name = stat.slice(stat.indexOf('(') + 1, close);
            all[name] = (all[name] || 0) + (Number(fields[11]) + Number(fields[12])) / ticks;
          } catch (e) { /* the thread ended meanwhile */ }
        }
        return all;
      };
      const residentMB = () => Number(/VmRSS:\\s+(\\d+)/.exec(fs.readFileSync('/proc/self/status', 'utf8'))[1]) / 1024;
      addon.initialize();
      const find = (type, name) => events.find((e) => e.type === 'new source' && e.source.type === type &&
        (!name || e.source.name === name))?.source;
      const sources = {
        display: find('dxgi'), camera: find('mfce_video'), speakers: find('wasapi', 'Tavio Speakers'),
        microphone: find('mfce_audio'),
      };
      for (const [kind, s] of Object.entries(sources)) if (!s) throw new Error('no ' + kind + ' source');
      const files = ${JSON.stringify(ours)};
      const pictures = [sources.display, sources.camera];
      const meters = [sources.speakers, sources.microphone];
      const video = setInterval(() => { for (const s of pictures) addon.getPreview(s.id, 640, 360); }, 1000 / 15);
      const audio = setInterval(() => { for (const s of meters) addon.getPreview(s.id); }, 100);
      await sleep(3000);  // every source has started and previews
      const before = cpu();
      const threadsBefore = byThread();
      const start = Date.now();
      for (const [kind, s] of Object.entries(sources)) addon.startCapture(s.id, files[kind]);
      await sleep(10000);
      const at10 = residentMB();
      await sleep(${seconds * 1000} - (Date.now() - start));
      const atEnd = residentMB();
      // Before the stops: the encoders' threads end with their files.
      const threads = Object.entries(byThread()).map(([name, c]) => [name, c - (threadsBefore[name] || 0)])
        .filter(([, c]) => c > 0.05).sort((a, b) => b[1] - a[1]);
      for (const s of Object.values(sources)) addon.stopCapture(s.id);
      const used = cpu() - before;
      const wall = (Date.now() - start) / 1000;
      clearInterval(video);
      clearInterval(audio);
      await sleep(2000);  // the files are finished on the sources' threads
      report({ cpu: used, wall, at10, atEnd, threads });
    `, { env: { ...desktop.env, TAVIO_TEST_CAMERAS: `Bench Camera=${CAMERA}` }, timeoutMs: (seconds + 60) * 1000 });
    if (!run.reports.length) throw new Error(`add-on run failed (${run.code}): ${run.stderr}`);
    const { cpu, wall, at10, atEnd, threads } = run.reports[0];
    const ourFiles = Object.fromEntries(Object.entries(ours).map(([k, f]) => [k, probe(f)]));

    const theirs = Object.fromEntries(Object.keys(ours).map((k) => [k, path.join(dir, `ffmpeg-${k}.mp4`)]));
    const micRate = Math.round(ourFiles.microphone.bitRate / 1000) || 192;
    const commands = {
      display: ['-f', 'x11grab', '-framerate', '30', '-video_size', '1920x1080', '-i', `${desktop.env.DISPLAY}+0,0`,
        '-t', String(seconds), ...DISPLAY_X264, theirs.display],
      camera: ['-re', '-f', 'lavfi', '-i', `${CAMERA},format=yuyv422`, '-t', String(seconds), ...CAMERA_X264, theirs.camera],
      speakers: ['-f', 'pulse', '-i', 'tavio_speakers.monitor', '-t', String(seconds), '-c:a', 'aac', '-b:a', '192k', theirs.speakers],
      microphone: ['-f', 'pulse', '-i', 'tavio_mic', '-t', String(seconds), '-c:a', 'aac', '-b:a', `${micRate}k`, theirs.microphone],
    };
    const counted = Object.fromEntries(Object.entries(commands).map(([kind, c]) => [kind, { counted: c }]));
    const theirBySource = runFfmpeg(dir, counted, env);
    const theirCpu = total(theirBySource);

    // The same inputs and encoder settings, with raw pictures or samples between them.
    const untilDuration = (c) => c.indexOf('-t') + 2;
    const rawVideo = (size) => ['-f', 'rawvideo', '-pix_fmt', 'yuv420p', '-s', size, '-r', '30'];
    const rawAudio = ['-f', 'f32le', '-ac', '2', '-ar', '48000'];
    const raw = { display: rawVideo('1920x1080'), camera: rawVideo('1280x720'), speakers: rawAudio, microphone: rawAudio };
    const encoders = runFfmpeg(dir, Object.fromEntries(Object.entries(commands).map(([kind, c]) => [kind, {
      feed: [...c.slice(0, untilDuration(c)), ...raw[kind], '-'],
      counted: [...raw[kind], '-i', '-', ...c.slice(untilDuration(c), -1), path.join(dir, `encoder-${kind}.mp4`)],
    }])), env);
    const encoderCpu = total(encoders);
    const theirFiles = Object.fromEntries(Object.entries(theirs).map(([k, f]) => [k, probe(f)]));

    console.log(`${seconds} s of every source at once (the add-on's recording took ${wall.toFixed(1)} s of wall time)`);
    for (const kind of Object.keys(ours)) {
      const a = ourFiles[kind];
      const b = theirFiles[kind];
      const video = kind === 'display' || kind === 'camera';
      const count = (f) => video ? `${f.packets} frames (${(f.packets / f.duration).toFixed(1)}/s)` : `${f.packets} AAC packets`;
      console.log(`  ${kind.padEnd(10)} ours ${count(a)}, ${a.duration.toFixed(2)} s; ffmpeg ${count(b)}, ${b.duration.toFixed(2)} s` +
        (video ? `; frames ours - ffmpeg: ${a.packets - b.packets}` : ''));
      if (video) {
        const [mine, other] = [distinct(ours[kind]), distinct(theirs[kind])];
        console.log(`  ${''.padEnd(10)} pictures that differ from the one before: ours ${mine}, ffmpeg ${other} ` +
          `(ours - ffmpeg: ${mine - other})`);
      }
    }
    console.log(`CPU: ours ${cpu.toFixed(1)} s (${(100 * cpu / wall).toFixed(0)} % of a core, previews included), ` +
      `ffmpeg's four ${theirCpu.toFixed(1)} s (${(100 * theirCpu / seconds).toFixed(0)} %)`);
    console.log(`CPU, ours / ffmpeg: ${((cpu / wall) / (theirCpu / seconds)).toFixed(2)} (target <= 0.8)`);
    const ourRest = cpu / wall * seconds - encoderCpu;
    console.log(`  floor, the four encoders alone: ${encoderCpu.toFixed(1)} s (${(encoderCpu / theirCpu).toFixed(2)} of ` +
      `ffmpeg's four: ${Object.entries(encoders).map(([k, c]) => `${k} ${c.toFixed(1)} s`).join(', ')}); ` +
      `the rest: ours ${ourRest.toFixed(1)} s, ffmpeg ${(theirCpu - encoderCpu).toFixed(1)} s ` +
      `(${(ourRest / (theirCpu - encoderCpu)).toFixed(2)})`);
    console.log(`  ours by thread name: ${threads.map(([n, c]) => `${n} ${c.toFixed(1)} s`).join(', ')}`);
    // Threads by source: encoders' threads carry the name of the thread that opened them. The
    // camera's engine and reader also serve its microphone; the previews run on Node's thread.
    const named = Object.fromEntries(threads);
    const sum = (...names) => names.reduce((a, n) => a + (named[n] || 0), 0);
    const split = [
      ['display', sum('tavio-record', 'tavio-screen'), theirBySource.display],
      ['camera + microphone', sum('tavio-engine', 'tavio-reader'), theirBySource.camera + theirBySource.microphone],
      ['speakers', sum('tavio-capture', 'tavio-silence', 'tavio-pulse'), theirBySource.speakers],
    ];
    for (const [kind, mine, theirs] of split)
      console.log(`  ${kind}: ours ${mine.toFixed(1)} s, ffmpeg ${theirs.toFixed(1)} s (${(mine / theirs).toFixed(2)})`);
    console.log(`resident memory: ${at10.toFixed(1)} MB at 10 s, ${atEnd.toFixed(1)} MB at ${seconds} s`);
  } finally {
    animation.kill('SIGTERM');
    tone.kill('SIGTERM');
    desktop.stop();
    fs.rmSync(dir, { recursive: true, force: true });
  }
}

const total = (bySource) => Object.values(bySource).reduce((a, b) => a + b, 0);

main().catch((e) => { console.error(e); process.exit(1); });
