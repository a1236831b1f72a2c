// "KIVO.Core.Package.Feed" (docs/feeds.md): the package servers added beside
// the vendor's. The address is a feed's key. Every method but "list" takes
// its argument as one JSON text in `list`.

import type { Api, Result } from './client';

const kFeed = 'KIVO.Core.Package.Feed';

export interface Feed {
  feed: string;
  name: string;
}

export function listFeeds(api: Api): Promise<Result<{ items: Feed[] }>> {
  return api.call<{ items: Feed[] }>(kFeed, 'list', 1);
}

// What adding a feed found: whether it publishes signing keys, and how many
// packages its catalogue lists (0: it answers but lists nothing).
export interface FeedAdded {
  has_keyrings?: boolean;
  packages?: number;
}

// The appliance asks the server before it stores the feed, which may take up
// to its catalogue time-out. Only this answer says whether the feed
// publishes signing keys.
export function addFeed(api: Api, feed: Feed): Promise<Result<FeedAdded | null>> {
  return api.call<FeedAdded | null>(kFeed, 'add', 1, { list: JSON.stringify(feed) });
}

// "set" changes name and address together; the address stays.
export function renameFeed(api: Api, feed: Feed, name: string): Promise<Result<unknown>> {
  return api.call(kFeed, 'set', 1, { list: JSON.stringify({ orifeed: feed.feed, feed: feed.feed, name }) });
}

export function deleteFeed(api: Api, feed: Feed): Promise<Result<unknown>> {
  return api.call(kFeed, 'delete', 1, { list: JSON.stringify([feed.feed]) });
}
