'use strict';
// Records a 1920x1080 display that changes at 60 Hz for 20 s with the add-on, and the same
// display with ffmpeg's x11grab at the clips' declared 30 frames a second (the add-on places
// pictures on that grid) and libx264 at the sink writer's settings (superfast, zerolatency,
// Main, 10485760 bit/s), in the same run. Prints CPU seconds per written frame
// and written frames per second for both, and the ratio of CPU per frame. The add-on's figure
// is the CPU of its display threads (the screen pump, the recording thread and the encoder
// threads it starts), read from /proc while the recording runs: the process also keeps the
// test desktop's speakers and microphone capturing, which ffmpeg doesn't. The whole process is
// printed too. With --load, one busy process per core runs through both recordings,
// as on a machine that is doing other work.
//   node bench/display.js [seconds] [--load]
const { spawn, spawnSync, execFileSync } = require('child_process');
const fs = require('fs');
const os = require('os');
const path = require('path');
const { startDesktop } = require('../scripts/desktop');
const { distinct } = require('./pictures');
const { ffmpegCpu } = require('./ffmpegcpu');
const { runAddon, root } = require('../test/js/addon');

const seconds = Number(process.argv.slice(2).find((a) => /^\d+$/.test(a)) || 20);
const load = process.argv.includes('--load');

function frames(file) {
  const r = spawnSync('ffprobe', ['-v', 'error', '-select_streams', 'v:0', '-count_packets', '-show_entries',
    'stream=nb_read_packets,profile,bit_rate', '-of', 'json', file], { encoding: 'utf8' });
  return JSON.parse(r.stdout).streams[0];
}

async function main() {
  const dir = fs.mkdtempSync(path.join(os.tmpdir(), 'tavio-bench-'));
  const xpattern = path.join(dir, 'xpattern');
  execFileSync('g++', ['-O2', '-o', xpattern, path.join(root, 'test/tools/xpattern.cc'), '-lxcb']);
  const desktop = await startDesktop({ width: 1920, height: 1080 });
  const env = { ...process.env, ...desktop.env };
  const animation = spawn(xpattern, ['0', '0', '1920', '1080', '60'], { env, stdio: 'ignore' });
  const busy = load ? os.cpus().map(() => spawn('sh', ['-c', 'while :; do :; done'], { stdio: 'ignore' })) : [];
  try {
    const ours = path.join(dir, 'ours.mp4');
    const { reports, stderr } = await runAddon(`
      const fs = require('fs');
      const ticks = Number(require('child_process').execFileSync('getconf', ['CLK_TCK'], { encoding: 'utf8' }));
      // CPU seconds of every live thread of this process, by thread id, with its name.
      const threads = () => {
        const all = new Map();
        for (const tid of fs.readdirSync('/proc/self/task')) {
          try {
            const stat = fs.readFileSync('/proc/self/task/' + tid + '/stat', 'utf8');
            const close = stat.lastIndexOf(')');
            const fields = stat.slice(close + 2).split(' ');
            all.set(tid, { name: stat.slice(stat.indexOf('(') + 1, close), cpu: (Number(fields[11]) + Number(fields[12])) / ticks });
          } catch (e) { /* the thread ended meanwhile */ }
        }
        return all;
      };
      addon.initialize();
      const display = events.find((e) => e.type === 'new source' && e.source.type === 'dxgi').source;
      const before = process.cpuUsage();
      const threadsBefore = threads();
      addon.startCapture(display.id, ${JSON.stringify(ours)});
      await sleep(${seconds * 1000});
      let displayCpu = 0;
      for (const [tid, t] of threads()) {
        if (t.name === 'tavio-screen' || t.name === 'tavio-record') displayCpu += t.cpu - (threadsBefore.get(tid)?.cpu ?? 0);
      }
      addon.stopCapture(display.id);
      await sleep(2000);
      const used = process.cpuUsage(before);
      report({ display: displayCpu, process: (used.user + used.system) / 1e6 });
    `, { env: desktop.env, timeoutMs: (seconds + 60) * 1000 });
    if (!reports.length) throw new Error(`add-on run failed: ${stderr}`);
    const ourCpu = reports[0].display;
    const ourStream = frames(ours);

    const theirs = path.join(dir, 'ffmpeg.mp4');
    const theirCpu = ffmpegCpu(dir, ['-f', 'x11grab', '-framerate', '30', '-video_size', '1920x1080', '-i',
      `${env.DISPLAY}+0,0`, '-t', String(seconds), '-c:v', 'libx264', '-preset', 'superfast', '-tune', 'zerolatency',
      '-profile:v', 'main', '-b:v', '10485760', '-pix_fmt', 'yuv420p', theirs], env);
    const theirStream = frames(theirs);

    const ourFrames = Number(ourStream.nb_read_packets);
    const theirFrames = Number(theirStream.nb_read_packets);
    const line = (name, cpu, n, s) => console.log(`${name}: ${n} frames, ${(n / seconds).toFixed(1)} frames/s, ` +
      `${cpu.toFixed(2)} CPU s, ${(cpu / n * 1000).toFixed(2)} CPU ms/frame, profile ${s.profile}, ${s.bit_rate} bit/s`);
    line('tavio_capture display threads', ourCpu, ourFrames, ourStream);
    line('tavio_capture whole process', reports[0].process, ourFrames, ourStream);
    line('ffmpeg x11grab', theirCpu, theirFrames, theirStream);
    console.log(`pictures that differ from the one before: ours ${distinct(ours)}, ffmpeg ${distinct(theirs)}`);
    console.log(`CPU per frame, ours / ffmpeg: ${((ourCpu / ourFrames) / (theirCpu / theirFrames)).toFixed(2)} (target <= 0.8); ` +
      `frames written, ours / ffmpeg: ${(ourFrames / theirFrames).toFixed(3)}${load ? ' (under load)' : ''}`);
  } finally {
    for (const b of busy) b.kill('SIGKILL');
    animation.kill('SIGTERM');
    desktop.stop();
    fs.rmSync(dir, { recursive: true, force: true });
  }
}

main().catch((e) => { console.error(e); process.exit(1); });
