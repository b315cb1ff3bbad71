"""Drives a headless Chromium by the DevTools protocol over a pipe."""
import base64, json, os, shutil, subprocess, tempfile, time

PROGRAMS = ('chromium', 'chromium-browser', 'google-chrome')


def program():
    return next((path for path in map(shutil.which, PROGRAMS) if path), None)


class Browser:
    """One page; everything that it logs or throws is in `complaints`, whatever it asks the network for in `requests`."""

    def __init__(self, path):
        self.profile = tempfile.mkdtemp()
        ours_in, theirs_out = os.pipe()
        theirs_in, ours_out = os.pipe()

        def arrange():
            # Descriptors 3 and 4 are the protocol's, whichever the pipes have.
            spare_in, spare_out = os.dup(theirs_in), os.dup(theirs_out)
            os.dup2(spare_in, 3)
            os.dup2(spare_out, 4)

        self.chromium = subprocess.Popen(
            [path, '--headless=new', '--no-sandbox', '--disable-gpu', '--disable-dev-shm-usage', '--no-first-run',
             '--disable-background-networking', '--remote-debugging-pipe', '--user-data-dir=' + self.profile, 'about:blank'],
            close_fds=False, preexec_fn=arrange, stdout=subprocess.DEVNULL, stderr=subprocess.DEVNULL)
        os.close(theirs_in)
        os.close(theirs_out)
        self.reader, self.writer = os.fdopen(ours_in, 'rb', 0), os.fdopen(ours_out, 'wb', 0)
        self.rest, self.number, self.session, self.events = b'', 0, None, []
        self.complaints, self.requests = [], []
        target = next(t for t in self.call('Target.getTargets')['targetInfos'] if t['type'] == 'page')['targetId']
        self.session = self.call('Target.attachToTarget', targetId=target, flatten=True)['sessionId']
        for domain in ('Page', 'Runtime', 'Log', 'Network'): self.call(domain + '.enable')

    def __enter__(self):
        return self

    def __exit__(self, *_):
        try:
            self.session = None
            self.call('Browser.close')
        except (OSError, EOFError):
            pass
        self.chromium.wait()
        shutil.rmtree(self.profile, ignore_errors=True)

    def _message(self):
        while b'\0' not in self.rest:
            more = self.reader.read(1 << 20)
            if not more: raise EOFError('the browser ended')
            self.rest += more
        text, self.rest = self.rest.split(b'\0', 1)
        message = json.loads(text)
        method, told = message.get('method'), message.get('params', {})
        if method == 'Runtime.consoleAPICalled': self.complaints.append(json.dumps(told['args']))
        elif method == 'Runtime.exceptionThrown': self.complaints.append(json.dumps(told['exceptionDetails']))
        elif method == 'Log.entryAdded': self.complaints.append(told['entry']['text'])
        elif method == 'Page.javascriptDialogOpening': self.complaints.append('a dialog: ' + told['message'])
        elif method == 'Network.requestWillBeSent': self.requests.append(told['request']['url'])
        if method: self.events.append(method)
        return message

    def call(self, method, **parameters):
        self.number += 1
        message = {'id': self.number, 'method': method, 'params': parameters}
        if self.session: message['sessionId'] = self.session
        self.writer.write(json.dumps(message).encode() + b'\0')
        while True:
            answer = self._message()
            if answer.get('id') != self.number: continue
            if 'error' in answer: raise RuntimeError(f'{method}: {answer["error"]}')
            return answer['result']

    def view(self, width, height, dark=False):
        self.call('Emulation.setDeviceMetricsOverride', width=width, height=height, deviceScaleFactor=1, mobile=False)
        self.call('Emulation.setEmulatedMedia', features=[
            {'name': 'prefers-color-scheme', 'value': 'dark' if dark else 'light'}, {'name': 'prefers-reduced-motion', 'value': 'reduce'}])

    def load(self, path):
        """Seconds until the page is drawn."""
        start = time.monotonic()
        self.events.clear()
        self.call('Page.navigate', url='file://' + os.path.abspath(path))
        while 'Page.loadEventFired' not in self.events: self._message()
        self.run('new Promise(done => requestAnimationFrame(() => requestAnimationFrame(() => done(0))))')
        return time.monotonic() - start

    def run(self, script):
        """The value of an expression in the page."""
        answer = self.call('Runtime.evaluate', expression=script, awaitPromise=True, returnByValue=True)
        if 'exceptionDetails' in answer: raise RuntimeError(f'{script}: {answer["exceptionDetails"]}')
        return answer['result'].get('value')

    def key(self, key, text=''):
        code = {'Enter': 13, 'Escape': 27, 'Tab': 9, 'ArrowRight': 39, 'ArrowLeft': 37, 'ArrowDown': 40, 'ArrowUp': 38}.get(key, 0)
        text = text or ('\r' if key == 'Enter' else '')
        self.call('Input.dispatchKeyEvent', type='keyDown', key=key, code=key, windowsVirtualKeyCode=code, text=text)
        self.call('Input.dispatchKeyEvent', type='keyUp', key=key, code=key, windowsVirtualKeyCode=code)

    def middle(self, selector):
        """Where an element's middle is in the window, after it was scrolled there."""
        return self.run(f"""(() => {{ const e = document.querySelector({json.dumps(selector)}); e.scrollIntoView({{block: 'center'}});
            const b = e.getBoundingClientRect(); return [b.x + b.width / 2, b.y + b.height / 2]; }})()""")

    def hover(self, selector):
        x, y = self.middle(selector)
        self.call('Input.dispatchMouseEvent', type='mouseMoved', x=x, y=y)

    def click(self, selector):
        x, y = self.middle(selector)
        for kind in ('mouseMoved', 'mousePressed', 'mouseReleased'):
            self.call('Input.dispatchMouseEvent', type=kind, x=x, y=y, button='left' if kind != 'mouseMoved' else 'none', clickCount=1)

    def picture(self, path, whole=False):
        shot = self.call('Page.captureScreenshot', format='png', captureBeyondViewport=whole)
        with open(path, 'wb') as file: file.write(base64.b64decode(shot['data']))
