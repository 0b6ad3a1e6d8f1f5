'use strict';
// A test camera that draws, in 16 columns, the wall clock in milliseconds (Gray code, so a tick
// while the columns are drawn gives the old or the new time, never a mix) at the moment its frame
// leaves the pacing filter, and the code a child process uses to read it back through getPreview:
// how long after leaving the source a picture is first seen by a host polling the preview.

// Bit b of the Gray code of the clock's milliseconds (mod 65536) in column b.
const CLOCK = 'color=c=black:size=16x9:rate=30,realtime,' +
  "geq=lum='16+219*mod(floor(mod(time(0)*1000,65536)/pow(2,X))+floor(mod(time(0)*1000,65536)/pow(2,X+1)),2)':cb=128:cr=128," +
  'scale=1280:720:flags=neighbor';

// Defines measureClock(cameraId, ms) in the child: the delays (ms) of the new pictures it saw.
const CLOCK_READER = `
const wallMs = () => performance.timeOrigin + performance.now();
const readClock = (cameraId) => {
  const W = 320, H = 180;
  const p = addon.getPreview(cameraId, W, H);
  if (!p || !p.length) return -1;
  let gray = 0;
  for (let b = 0; b < 16; b++) if (p[((H >> 1) * W + 10 + 20 * b) * 4] > 128) gray |= 1 << b;
  let value = 0;
  for (let g = gray; g; g >>= 1) value ^= g;
  return value;
};
const measureClock = async (cameraId, ms) => {
  const delays = [];
  let last = -1;
  const end = Date.now() + ms;
  while (Date.now() < end) {
    const value = readClock(cameraId);
    const now = wallMs();
    if (value >= 0 && value !== last) {
      last = value;
      delays.push((((Math.floor(now) - value) % 65536) + 65536) % 65536 + (now - Math.floor(now)));
    }
    await sleep(1);
  }
  return delays;
};
`;

module.exports = { CLOCK, CLOCK_READER };
