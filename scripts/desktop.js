'use strict';
// A private virtual desktop for tests and the demo: an Xvfb display (with optional RandR
// monitors) and a PulseAudio server with null sinks as playback endpoints and a sine source as
// a microphone. Everything lives in one temporary folder and is gone after stop().
const { spawn, spawnSync, execFileSync } = require('child_process');
const fs = require('fs');
const os = require('os');
const path = require('path');

function sleep(ms) {
  return new Promise((resolve) => setTimeout(resolve, ms));
}

// Starts Xvfb and resolves with its display name (":N"), read from -displayfd.
function startXvfb(width, height, extra, depth = 24) {
  return new Promise((resolve, reject) => {
    const xvfb = spawn('Xvfb', ['-displayfd', '3', '-screen', '0', `${width}x${height}x${depth}`, '-noreset', '-nolisten', 'tcp', ...extra], {
      stdio: ['ignore', 'ignore', 'pipe', 'pipe'],
    });
    let text = '';
    let errors = '';
    xvfb.stderr.on('data', (d) => { errors += d; });
    xvfb.stdio[3].on('data', (d) => {
      text += d;
      if (text.includes('\n')) resolve({ process: xvfb, display: `:${text.trim()}` });
    });
    xvfb.on('error', reject);
    xvfb.on('exit', (code) => reject(new Error(`Xvfb ended (${code}): ${errors}`)));
  });
}

function pulseConfig(dir, sinks, microphone, remapped) {
  const lines = [`load-module module-native-protocol-unix auth-anonymous=1 socket=${dir}/native`];
  for (const sink of sinks) {
    lines.push(`load-module module-null-sink sink_name=${sink.name} rate=${sink.rate || 48000} channels=${sink.channels || 2} ` +
      (sink.channelMap ? `channel_map=${sink.channelMap} ` : '') + `sink_properties="device.description='${sink.description}'"`);
  }
  if (sinks.length) lines.push(`set-default-sink ${sinks.find((s) => s.default)?.name || sinks[0].name}`);
  if (microphone) {
    // A sine source renders two seconds ahead at a time, whatever latency its readers ask for:
    // a microphone whose sound arrives in two-second lumps, stamped as if just captured.
    lines.push(`load-module module-sine-source source_name=${microphone.name} rate=${microphone.rate || 48000} ` +
      `frequency=${microphone.frequency || 440} source_properties="device.description='${microphone.description}'"`);
  }
  if (remapped) {
    // A low-latency microphone: a null sink's monitor remapped as a source of its own (a monitor
    // is no microphone), with a tone played into the sink. Its sound comes 20 ms at a time.
    lines.push(`load-module module-null-sink sink_name=${remapped.name}_feed rate=48000 channels=2 ` +
      `sink_properties="device.description='${remapped.description} Feed'"`);
    lines.push(`load-module module-remap-source master=${remapped.name}_feed.monitor source_name=${remapped.name} ` +
      `source_properties="device.description='${remapped.description}'"`);
  }
  return lines.join('\n') + '\n';
}

async function startPulse(dir, sinks, microphone, remapped) {
  fs.writeFileSync(path.join(dir, 'conf.pa'), pulseConfig(dir, sinks, microphone, remapped));
  const env = { ...process.env, HOME: dir, XDG_RUNTIME_DIR: dir };
  const r = spawnSync('pulseaudio', ['--daemonize=yes', '--exit-idle-time=-1', '--system=false', '-n',
    '-F', path.join(dir, 'conf.pa'), '--use-pid-file=yes', '--log-target=stderr'], { env, encoding: 'utf8' });
  if (r.status !== 0) throw new Error(`pulseaudio did not start: ${r.stderr}`);
  const server = `unix:${dir}/native`;
  for (let i = 0; i < 100; i++) {
    if (spawnSync('pactl', ['info'], { env: { ...process.env, PULSE_SERVER: server } }).status === 0) return server;
    await sleep(20);
  }
  throw new Error('pulseaudio did not answer');
}

/**
 * Starts what the environment does not already give (or everything, with `private: true`).
 * Options: width, height, monitors (xrandr --setmonitor arguments, e.g. ['LEFT 960/254x1080/286+0+0 screen']),
 * sinks ([{name, description, rate, channels, channelMap, default}], channelMap e.g. 'aux0,aux1'),
 * microphone ({name, description, frequency}), display (false: no X server), depth (the screen's
 * depth, 24 by default), xvfbArguments (more Xvfb arguments), audio (false: no sound server),
 * remappedMicrophone ({name, description, frequency}: a low-latency microphone beside the sine
 * source, a null sink "<name>_feed" with a tone playing into it, its monitor remapped as a source).
 * Resolves with { env, dir, stop() }: env holds DISPLAY and PULSE_SERVER for child processes.
 */
async function startDesktop(options = {}) {
  const {
    width = 1920, height = 1080, depth = 24, monitors = [], display = true, xvfbArguments = [], audio = true,
    sinks = [{ name: 'tavio_speakers', description: 'Tavio Speakers', default: true }],
    microphone = { name: 'tavio_mic', description: 'Tavio Microphone', frequency: 440 },
    remappedMicrophone = null,
  } = options;
  const own = options.private !== false;
  const dir = fs.mkdtempSync(path.join(os.tmpdir(), 'tavio-desktop-'));
  const env = {};
  let xvfb = null;
  let tone = null;
  try {
    if (display && (own || !process.env.DISPLAY)) {
      xvfb = await startXvfb(width, height, xvfbArguments, depth);
      env.DISPLAY = xvfb.display;
      for (const monitor of monitors) {
        execFileSync('xrandr', ['--setmonitor', ...monitor.split(' ')], { env: { ...process.env, DISPLAY: env.DISPLAY } });
      }
    } else if (display) {
      env.DISPLAY = process.env.DISPLAY;
    }
    if (audio && (own || !process.env.PULSE_SERVER)) {
      env.PULSE_SERVER = await startPulse(dir, sinks, microphone, remappedMicrophone);
      if (remappedMicrophone) {
        tone = playTone(env, { frequency: remappedMicrophone.frequency || 880, sink: `${remappedMicrophone.name}_feed` });
      }
    } else if (audio) {
      env.PULSE_SERVER = process.env.PULSE_SERVER;
    }
  } catch (e) {
    if (tone) tone.kill('SIGKILL');
    stopAll(xvfb, dir);
    throw e;
  }
  const stopTone = () => { if (tone) tone.kill('SIGKILL'); };
  return {
    env,
    dir,
    xvfbPid: xvfb && xvfb.process.pid,
    stop: () => { stopTone(); stopAll(xvfb, dir); },
    stopAfterExit: () => { if (tone) tone.unref(); stopAfterExit(xvfb, dir); },
  };
}

function stopAll(xvfb, dir) {
  const pidFile = path.join(dir, 'pulse', 'pid');
  if (fs.existsSync(pidFile)) {
    const pid = Number(fs.readFileSync(pidFile, 'utf8'));
    try {
      process.kill(pid, 'SIGTERM');
      // The server writes into the folder until it is gone; wait for it (at most a second).
      const pause = new Int32Array(new SharedArrayBuffer(4));
      const alive = () => {
        try {
          return !/^\d+ \(.*\) Z/.test(fs.readFileSync(`/proc/${pid}/stat`, 'utf8'));  // a zombie is gone
        } catch (_) {
          return false;
        }
      };
      for (let i = 0; i < 100 && alive(); i++) Atomics.wait(pause, 0, 0, 10);
    } catch (_) { /* gone */ }
  }
  if (xvfb) xvfb.process.kill('SIGTERM');
  fs.rmSync(dir, { recursive: true, force: true, maxRetries: 5, retryDelay: 50 });
}

// For a process whose capture threads use the servers until it ends: a detached helper stops
// them once this process is gone, so the threads never see their servers vanish.
function stopAfterExit(xvfb, dir) {
  const pidFile = path.join(dir, 'pulse', 'pid');
  const pids = [xvfb && xvfb.process.pid, fs.existsSync(pidFile) && fs.readFileSync(pidFile, 'utf8').trim()]
    .filter(Boolean).join(' ');
  const script = `while kill -0 ${process.pid} 2>/dev/null; do sleep 0.1; done; kill ${pids} 2>/dev/null; sleep 0.5; rm -rf '${dir}'`;
  spawn('sh', ['-c', script], { detached: true, stdio: 'ignore' }).unref();
  if (xvfb) xvfb.process.unref();
}

// A moving test picture in a borderless window at (x, y); returns the child process.
function startAnimation(env, { x = 100, y = 100, width = 640, height = 360, rate = 30 } = {}) {
  return spawn('ffmpeg', ['-loglevel', 'error', '-re', '-f', 'lavfi', '-i', `testsrc2=size=${width}x${height}:rate=${rate}`,
    '-f', 'sdl2', '-window_x', String(x), '-window_y', String(y), '-window_borderless', '1', 'tavio animation'],
  { env: { ...process.env, ...env }, stdio: 'ignore' });
}

// A sine tone played into a sink (the default one when none is named); returns the child process.
function playTone(env, { frequency = 440, amplitude = 0.5, sink } = {}) {
  // lavfi's sine has amplitude 1/8; both channels carry it at full level (no -3 dB upmix).
  const args = ['-loglevel', 'error', '-re', '-f', 'lavfi', '-i',
    `sine=frequency=${frequency}:sample_rate=48000,volume=${amplitude * 8},pan=stereo|c0=c0|c1=c0`, '-f', 'pulse'];
  if (sink) args.push('-device', sink);
  args.push('tavio tone');
  return spawn('ffmpeg', args, { env: { ...process.env, ...env }, stdio: 'ignore' });
}

module.exports = { startDesktop, startAnimation, playTone };
