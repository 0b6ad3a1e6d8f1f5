// A typed host, compiled by test/js/types.test.js with tsc --noEmit --strict. Each line under an
// expect-error mark must stay an error: declarations that let it through are too loose.
import capture = require('../..');

const previews = new Map<number, { width: number; height: number }>();
const audio: number[] = [];

capture.setCallback((event) => {
  switch (event.type) {
    case 'new source': {
      const { source } = event;
      if (source.type === 'dxgi' || source.type === 'mfce_video') {
        previews.set(source.id, { width: source.width / 4, height: source.height / 4 });
        const bytes: number = source.size * source.pixelWidth;
        void bytes;
      } else {
        audio.push(source.id);
        // @ts-expect-error an audio source has no picture size
        void source.width;
      }
      const selected: boolean = source.selected === 1;
      void selected;
      break;
    }
    case 'new-clip': {
      const started: Date = new Date(event.start);
      const file: string = event.filename;
      void [started, file, event.uid];
      // @ts-expect-error a clip event carries no source
      void event.source;
      break;
    }
    // @ts-expect-error no such event
    case 'new clip':
      break;
    default: {
      const none: never = event;
      void none;
    }
  }
});
capture.initialize();

for (const [uid, { width, height }] of previews) {
  const pixels = capture.getPreview(uid, width, height);
  if (pixels) {
    const red: number = pixels[0];
    void red;
  }
  capture.mouseCapture(uid, 0);
}
for (const uid of audio) {
  const peaks = capture.getPreview(uid);
  if (peaks) {
    const level: number = Math.max(peaks.left, peaks.right, peaks['0']);
    void level;
  }
}
capture.startCapture(0, 'clip.mp4');
capture.stopCapture(0);
const posted: 0 | 1 = capture.transfer(0x1200007);
void posted;

// @ts-expect-error uids are numbers
capture.startCapture('0', 'clip.mp4');
// @ts-expect-error the callback takes one event
capture.setCallback((event: string) => event);
// @ts-expect-error there are seven functions and this is none of them
capture.startRecording(0);
