'use strict';
// CPU seconds (user + system) of ffmpeg processes: each runs in a subshell that prints `times`
// when it ends, whose second line is that one process's own.
const { spawnSync } = require('child_process');
const fs = require('fs');
const path = require('path');

const quote = (a) => `'${a.replace(/'/g, "'\\''")}'`;
const ffmpeg = (args) => `ffmpeg -nostdin -v error -y ${args.map(quote).join(' ')}`;

// Runs ffmpeg processes side by side and returns each one's CPU in seconds, by name: a command's
// `counted` process, fed by its `feed` process through a pipe when it has one (that is not counted).
function runFfmpeg(dir, commands, env = process.env) {
  const timesDir = fs.mkdtempSync(path.join(dir, 'times-'));
  const times = (name) => path.join(timesDir, name);
  const script = Object.entries(commands).map(([name, { feed, counted }]) =>
    `${feed ? `${ffmpeg(feed)} | ` : ''}(${ffmpeg(counted)}; times > ${quote(times(name))}) &`).join('\n') + '\nwait';
  const run = spawnSync('bash', ['-c', script], { env, encoding: 'utf8' });
  if (run.status !== 0 || run.stderr.trim()) throw new Error(`ffmpeg failed: ${run.stderr}`);
  return Object.fromEntries(Object.keys(commands).map((name) => {
    const m = fs.readFileSync(times(name), 'utf8').trim().split('\n').pop().match(/(\d+)m([\d.]+)s (\d+)m([\d.]+)s/);
    return [name, Number(m[1]) * 60 + Number(m[2]) + Number(m[3]) * 60 + Number(m[4])];
  }));
}

// The CPU seconds of one ffmpeg run with `args`.
const ffmpegCpu = (dir, args, env) => runFfmpeg(dir, { run: { counted: args } }, env).run;

module.exports = { runFfmpeg, ffmpegCpu };
