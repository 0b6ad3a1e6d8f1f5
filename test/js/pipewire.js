'use strict';
// A private PipeWire with its PulseAudio server (as Debian 12's desktops run it): a session bus,
// the daemon, its session manager and the PulseAudio server, all in one temporary folder. Its
// devices are made through the PulseAudio server: null sinks as playback endpoints, and a null
// sink's monitor remapped as a microphone.
const { spawn, spawnSync, execFileSync } = require('child_process');
const fs = require('fs');
const os = require('os');
const path = require('path');

const sleep = (ms) => new Promise((resolve) => setTimeout(resolve, ms));

/**
 * sinks: [{name, description}], the first the default; microphone: {name, description}, fed by a
 * sink "<name>_feed". Resolves with { env (PULSE_SERVER), stop() }.
 */
async function startPipeWire({ sinks, microphone }) {
  const dir = fs.mkdtempSync(path.join(os.tmpdir(), 'tavio-pipewire-'));
  const children = [];
  const stop = () => {
    for (const child of children.reverse()) child.kill('SIGTERM');
    fs.rmSync(dir, { recursive: true, force: true, maxRetries: 5, retryDelay: 50 });
  };
  try {
    const bus = execFileSync('dbus-daemon', ['--session', '--fork', '--print-address=1', '--print-pid=1',
      `--address=unix:path=${dir}/bus`], { encoding: 'utf8' }).trim().split('\n');
    children.push({ kill: () => { try { process.kill(Number(bus[1])); } catch (_) { /* gone */ } } });
    const env = { ...process.env, XDG_RUNTIME_DIR: dir, PIPEWIRE_RUNTIME_DIR: dir, DBUS_SESSION_BUS_ADDRESS: bus[0] };
    for (const program of ['pipewire', 'wireplumber', 'pipewire-pulse']) {
      children.push(spawn(program, [], { env, stdio: 'ignore' }));
      await sleep(200);
    }
    const server = { PULSE_SERVER: `unix:${dir}/pulse/native` };
    const pactl = (...args) => execFileSync('pactl', args, { env: { ...process.env, ...server }, encoding: 'utf8' });
    // A pactl command that fails until a program started above is ready, tried for five seconds.
    const retried = async (args, failure) => {
      for (let i = 0; spawnSync('pactl', args, { env: { ...process.env, ...server } }).status !== 0; i++) {
        if (i === 100) throw new Error(failure);
        await sleep(50);
      }
    };
    await retried(['info'], 'PipeWire\'s PulseAudio server did not answer');
    const sink = ({ name, description }) => pactl('load-module', 'module-null-sink', `sink_name=${name}`,
      `sink_properties="device.description='${description}'"`);
    sinks.forEach(sink);
    // The session manager keeps the default; until it is ready the server answers "Not supported".
    await retried(['set-default-sink', sinks[0].name], `PipeWire did not take ${sinks[0].name} as its default sink`);
    sink({ name: `${microphone.name}_feed`, description: `${microphone.description} Feed` });
    pactl('load-module', 'module-remap-source', `master=${microphone.name}_feed.monitor`, `source_name=${microphone.name}`,
      `source_properties="device.description='${microphone.description}'"`);
    // The session manager links new nodes a moment after they appear.
    await sleep(500);
    return { env: server, stop };
  } catch (error) {
    stop();
    throw error;
  }
}

module.exports = { startPipeWire };
