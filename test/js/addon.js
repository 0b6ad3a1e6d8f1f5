'use strict';
// Runs a piece of JavaScript against the add-on in a child Node process. The add-on starts
// threads that never end, so every case that calls initialize gets a process of its own.
const { spawn } = require('child_process');
const path = require('path');

const root = path.resolve(__dirname, '..', '..');
const MARK = '@@tavio-report ';

// The environment of a host process: TAVIO_TEST_PRELOAD (a sanitizer's runtime, for an add-on
// built with it) is preloaded into the host only; the host clears it again (HOST_START) so that
// the players and tools it starts run as they are.
function hostEnv(env) {
  const preload = process.env.TAVIO_TEST_PRELOAD;
  return { ...process.env, ...env, ...(preload ? { LD_PRELOAD: preload } : {}) };
}
const HOST_START = process.env.TAVIO_TEST_PRELOAD ? 'delete process.env.LD_PRELOAD;' : '';

function prelude(callback) {
  return `${HOST_START}
const addon = require(${JSON.stringify(root)});
const events = [];
${callback ? 'addon.setCallback((event) => events.push(event));' : ''}
const report = (value) => process.stdout.write(${JSON.stringify(MARK)} + JSON.stringify(value) + '\\n');
const sleep = (ms) => new Promise((resolve) => setTimeout(resolve, ms));
`;
}

/**
 * Runs `script` (may use await) with `addon`, `events`, `report(value)` and `sleep(ms)` defined;
 * the events arrive through a callback set before the script runs, unless `callback` is false.
 * Resolves { reports, stdout, stderr, code, signal }: stdout without the report lines. The child is
 * ended when the script finishes, or killed after timeoutMs.
 */
function runAddon(script, { env = {}, timeoutMs = 60000, callback = true } = {}) {
  const source = `${prelude(callback)}
(async () => {
${script}
})().then(() => process.exit(0), (error) => { console.error(error); process.exit(3); });
`;
  return new Promise((resolve) => {
    const child = spawn(process.execPath, ['-e', source], {
      env: hostEnv(env),
      stdio: ['ignore', 'pipe', 'pipe'],
    });
    let stdout = '';
    let stderr = '';
    child.stdout.on('data', (d) => { stdout += d; });
    child.stderr.on('data', (d) => { stderr += d; });
    const timer = setTimeout(() => child.kill('SIGKILL'), timeoutMs);
    child.on('close', (code, signal) => {
      clearTimeout(timer);
      const reports = [];
      const lines = [];
      for (const line of stdout.split('\n')) {
        if (line.startsWith(MARK)) reports.push(JSON.parse(line.slice(MARK.length)));
        else if (line) lines.push(line);
      }
      resolve({ reports, stdout: lines.join('\n'), stderr, code, signal });
    });
  });
}

module.exports = { runAddon, root, hostEnv, HOST_START };
