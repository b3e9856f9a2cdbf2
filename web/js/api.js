// The page's only way to the server: the /api/v1/ endpoints, authorised by the session cookie.
const BASE = '/api/v1';

export class ApiError extends Error {
  constructor(status, body) {
    const message = (body && body.error && body.error.message) || `request failed (${status})`;
    super(message);
    this.status = status;
    this.code = body && body.error ? body.error.code : undefined;
  }
}

export const ROOT = 'root';
export const ROOT_IDENTIFIER = 'HostPorterRootContainerItemIdentifier';
// The provider refuses new items directly in the root container with this code.
export const WRITE_REFUSED = 513;

export function isRoot(id) {
  return id === ROOT || id === ROOT_IDENTIFIER;
}

export function itemPath(id, suffix = '') {
  return `${BASE}/items/${encodeURIComponent(id)}${suffix}`;
}

export async function request(method, path, body) {
  const options = { method, credentials: 'same-origin', headers: {} };
  if (body !== undefined) {
    options.headers['Content-Type'] = 'application/json';
    options.body = JSON.stringify(body);
  }
  let response;
  try {
    response = await fetch(BASE + path, options);
  } catch (e) {
    throw new ApiError(0, { error: { message: 'the server cannot be reached' } });
  }
  const text = await response.text();
  let json = null;
  try { json = text ? JSON.parse(text) : null; } catch (e) { json = null; }
  if (!response.ok) throw new ApiError(response.status, json);
  return json;
}

// Trades the run's token for the session cookie; false when the token is refused.
export async function openSession(token) {
  const response = await fetch(`${BASE}/session`, {
    method: 'POST', credentials: 'same-origin', headers: { Authorization: `Bearer ${token}` },
  });
  return response.ok;
}

export const api = {
  status: () => request('GET', '/status'),
  apps: () => request('GET', '/apps'),
  item: (id) => request('GET', `/items/${encodeURIComponent(id)}`),
  children: (id, page) => request('GET', `/containers/${encodeURIComponent(id)}/children` +
    (page ? `?page=${encodeURIComponent(page)}` : '')),
  search: (params) => request('GET', `/search?${new URLSearchParams(params)}`),
  patch: (id, fields) => request('PATCH', `/items/${encodeURIComponent(id)}`, fields),
  remove: (id) => request('DELETE', `/items/${encodeURIComponent(id)}`),
  newFolder: (parent, name) => request('POST', `/containers/${encodeURIComponent(parent)}/children`,
    { folder: name, bounce: true }),
  contentUrl: (id) => itemPath(id, '/content'),
  thumbnailUrl: (id, size) => itemPath(id, `/thumbnail?size=${size}`),
  uploadUrl: (parent) => `${BASE}/containers/${encodeURIComponent(parent)}/children`,
  eventsUrl: () => `${BASE}/events`,
};
