// A strict collector for OTLP/HTTP logs in JSON: a field that the published definitions do not know or
// would change is an error. Listens on a free port of the loopback and prints the port, then a JSON
// line with the decoded request and the answer for each request.
//
// POST /answers takes a JSON list with the answers of the next requests: {"status", "headers", "body"},
// "reset" or "hang". POST /poison takes a text; each request that holds the text is answered with 400.
'use strict';
const http = require('http');
const zlib = require('zlib');
const root = require('@opentelemetry/otlp-transformer/build/src/generated/root');

const Request = root.opentelemetry.proto.collector.logs.v1.ExportLogsServiceRequest;
let answers = [];
let poison = null;

// Every sent field must be in the decoded request: the decoder drops a misspelt or misplaced field
// silently.
function compare(sent, decoded, place) {
  if (sent === null || typeof sent !== 'object') {
    // NaN and the infinities are texts in the protocol's JSON.
    if (String(sent) !== String(decoded)) throw Error(`${place}: sent ${sent}, decoded ${decoded}`);
    return;
  }
  for (const key of Object.keys(sent)) {
    const known = decoded !== null && decoded !== undefined && key in decoded;
    if (!known && Array.isArray(sent[key]) && sent[key].length === 0) continue; // equals an absent list
    if (!known) throw Error(`unknown ${place}.${key}`);
    compare(sent[key], decoded[key], `${place}.${key}`);
  }
}

function decode(body) {
  const sent = JSON.parse(body);
  const message = Request.decode(Request.encode(Request.fromObject(sent)).finish());
  const decoded = Request.toObject(message, { longs: String, enums: String });
  compare(sent, decoded, '$');
  return decoded;
}

function answerTo(text) {
  if (answers.length > 0) return answers.shift();
  if (poison !== null && text.includes(poison)) return { status: 400, body: 'poisoned' };
  return { status: 200, body: '{}' };
}

function respond(request, response, body) {
  if (request.url === '/answers') {
    answers = JSON.parse(body);
    return response.end();
  }
  if (request.url === '/poison') {
    poison = body.toString();
    return response.end();
  }
  let text = body;
  if (request.headers['content-encoding'] === 'gzip') text = zlib.gunzipSync(body);
  text = text.toString();
  const answer = answerTo(text);
  const line = { path: request.url, headers: request.headers, bytes: body.length, answer };
  try {
    line.request = decode(text);
  } catch (error) {
    line.fault = error.message;
  }
  console.log(JSON.stringify(line));
  if (answer === 'reset') return request.socket.destroy();
  if (answer === 'hang') return undefined;
  response.writeHead(answer.status, { 'Content-Type': 'application/json', ...answer.headers });
  return response.end(answer.body);
}

const server = http.createServer((request, response) => {
  const parts = [];
  request.on('data', (part) => parts.push(part));
  request.on('end', () => respond(request, response, Buffer.concat(parts)));
});
server.listen(0, '127.0.0.1', () => console.log(server.address().port));
