// SPDX-License-Identifier: GPL-2.0
/*
 * The factory driver's netlink side: the kernel end of netlink protocol 23,
 * which sends test command frames to the factory test daemon and takes every
 * frame the daemon sends back.
 *
 * User space drives it through a misc character device, /dev/kestrel_factory:
 *   write()  one command frame (nlmsghdr and payload; nlmsg_len is the
 *            write's length, or that length less the alignment bytes after
 *            the payload), sent to the daemon's port id from port id 0;
 *   read()   one whole datagram the daemon sent, in arrival order, for every
 *            file opened for reading (each such file has its own bounded
 *            queue);
 *   poll()   readable while that queue holds a datagram, always writable.
 * Counters sit beside the device in sysfs (sent, received, malformed,
 * rejected writes, and dropped: every datagram of the daemon that a reading
 * file did not get, because none was open, its queue was full, or it was
 * closed before reading it); debugfs has an "inject" file whose every write
 * goes to the daemon unchecked, for tests of the daemon's frame walk.
 *
 * The kernel filters netlink protocols it does not know from netlink
 * monitors (nlmon), so the module hands a copy of every frame it sends and
 * receives to each netlink monitor device that is up, the way the kernel's
 * own taps do, and a capture on nlmon0 shows the whole session.
 */
#include <linux/atomic.h>
#include <linux/debugfs.h>
#include <linux/delay.h>
#include <linux/device.h>
#include <linux/fs.h>
#include <linux/if_arp.h>
#include <linux/if_packet.h>
#include <linux/miscdevice.h>
#include <linux/module.h>
#include <linux/netdevice.h>
#include <linux/netlink.h>
#include <linux/poll.h>
#include <linux/rcupdate.h>
#include <linux/refcount.h>
#include <linux/skbuff.h>
#include <linux/slab.h>
#include <linux/spinlock.h>
#include <linux/uaccess.h>
#include <linux/wait.h>
#include <net/net_namespace.h>
#include <net/sock.h>

#define KF_PROTOCOL 23
#define KF_MAX_FRAME 1024	/* the daemon's receive buffer */
#define KF_QUEUE_LEN 256	/* datagrams a reading file holds */

static unsigned int daemon_port = 20000;
module_param(daemon_port, uint, 0644);
MODULE_PARM_DESC(daemon_port,
		 "netlink port id of the factory test daemon (default 20000)");

static bool mirror = true;
module_param(mirror, bool, 0644);
MODULE_PARM_DESC(mirror,
		 "copy every frame to the netlink monitor devices that are up");

/* Payload size of every frame type the daemon sends. */
static const struct {
	u16 type;
	u16 payload;
} kf_frame_sizes[] = {
	{ 0, 2 },   { 2, 16 },  { 3, 8 },   { 5, 44 },   { 7, 8 },   { 9, 72 },
	{ 10, 60 }, { 11, 36 }, { 12, 36 }, { 14, 60 },  { 15, 12 }, { 16, 12 },
	{ 20, 129 }, { 30, 16 }, { 33, 16 }, { 34, 2 },
};

struct kf_reader {
	struct list_head node;
	struct sk_buff_head queue;
	wait_queue_head_t wait;
};

static struct sock *kf_sock;
static struct dentry *kf_debugfs;
static LIST_HEAD(kf_readers);
static DEFINE_SPINLOCK(kf_readers_lock);

static atomic_long_t kf_sent = ATOMIC_LONG_INIT(0);
static atomic_long_t kf_received = ATOMIC_LONG_INIT(0);
static atomic_long_t kf_malformed = ATOMIC_LONG_INIT(0);
static atomic_long_t kf_dropped = ATOMIC_LONG_INIT(0);
static atomic_long_t kf_rejected = ATOMIC_LONG_INIT(0);

/*
 * One datagram of the daemon: a single frame whose length and payload size
 * its type fixes.
 */
static bool kf_frame_ok(const u8 *data, unsigned int len)
{
	struct nlmsghdr hdr;
	size_t i;

	if (len < NLMSG_HDRLEN)
		return false;
	memcpy(&hdr, data, sizeof(hdr));
	if (hdr.nlmsg_len != len)
		return false;
	for (i = 0; i < ARRAY_SIZE(kf_frame_sizes); i++)
		if (kf_frame_sizes[i].type == hdr.nlmsg_type)
			return hdr.nlmsg_len ==
			       NLMSG_SPACE(kf_frame_sizes[i].payload);
	return false;
}

/*
 * A copy of one datagram for every netlink monitor that is up, as the
 * kernel's taps make it: packet type PACKET_KERNEL for a datagram to the
 * kernel, PACKET_USER for one from it.
 */
static struct sk_buff *kf_mirror_copies(const void *data, unsigned int len,
					bool to_kernel)
{
	struct sk_buff *list = NULL;
	struct net_device *dev;

	if (!mirror)
		return NULL;
	rcu_read_lock();
	for_each_netdev_rcu(&init_net, dev) {
		struct sk_buff *skb;

		if (dev->type != ARPHRD_NETLINK || !(dev->flags & IFF_UP))
			continue;
		skb = alloc_skb(len, GFP_ATOMIC);
		if (!skb)
			continue;
		skb_put_data(skb, data, len);
		dev_hold(dev);
		skb->dev = dev;
		skb->protocol = htons(KF_PROTOCOL);
		skb->pkt_type = to_kernel ? PACKET_KERNEL : PACKET_USER;
		skb_reset_network_header(skb);
		skb->next = list;
		list = skb;
	}
	rcu_read_unlock();
	return list;
}

/* Sends (or, with send false, frees) the copies kf_mirror_copies made. */
static void kf_mirror_send(struct sk_buff *list, bool send)
{
	while (list) {
		struct sk_buff *skb = list;
		struct net_device *dev = skb->dev;

		list = skb->next;
		skb->next = NULL;
		if (send)
			dev_queue_xmit(skb);
		else
			kfree_skb(skb);
		dev_put(dev);
	}
}

/* Every datagram the daemon sends to port id 0. */
static void kf_input(struct sk_buff *skb)
{
	struct kf_reader *r;
	bool queued = false;

	atomic_long_inc(&kf_received);
	if (!kf_frame_ok(skb->data, skb->len))
		atomic_long_inc(&kf_malformed);
	kf_mirror_send(kf_mirror_copies(skb->data, skb->len, true), true);

	spin_lock_bh(&kf_readers_lock);
	list_for_each_entry(r, &kf_readers, node) {
		struct sk_buff *copy = NULL;

		queued = true;
		/*
		 * Only this function adds to the queue, under kf_readers_lock;
		 * kf_read takes from it under the queue's own lock, so read
		 * the length locklessly (a stale value is only ever larger).
		 */
		if (skb_queue_len_lockless(&r->queue) < KF_QUEUE_LEN)
			copy = alloc_skb(skb->len, GFP_ATOMIC);
		if (!copy) {
			atomic_long_inc(&kf_dropped);
			continue;
		}
		skb_put_data(copy, skb->data, skb->len);
		skb_queue_tail(&r->queue, copy);
		wake_up_interruptible_poll(&r->wait, EPOLLIN | EPOLLRDNORM);
	}
	spin_unlock_bh(&kf_readers_lock);
	if (!queued)
		atomic_long_inc(&kf_dropped);
}

/*
 * One datagram of len bytes from user space to the daemon, from port id 0.
 * With check, the caller has made sure that len >= NLMSG_HDRLEN, which is
 * sizeof(struct nlmsghdr): the header is whole in the skb.
 */
static ssize_t kf_send(const char __user *buf, size_t len, bool check)
{
	struct sk_buff *skb, *copies;
	struct nlmsghdr hdr;
	int err;

	skb = alloc_skb(len, GFP_KERNEL);
	if (!skb)
		return -ENOMEM;
	if (copy_from_user(skb_put(skb, len), buf, len)) {
		kfree_skb(skb);
		return -EFAULT;
	}
	if (check) {
		memcpy(&hdr, skb->data, sizeof(hdr));
		if (hdr.nlmsg_len < NLMSG_HDRLEN ||
		    (hdr.nlmsg_len != len &&
		     NLMSG_ALIGN(hdr.nlmsg_len) != len)) {
			atomic_long_inc(&kf_rejected);
			kfree_skb(skb);
			return -EINVAL;
		}
	}
	copies = kf_mirror_copies(skb->data, len, false);
	NETLINK_CB(skb).portid = 0;
	NETLINK_CB(skb).dst_group = 0;
	err = netlink_unicast(kf_sock, skb, READ_ONCE(daemon_port),
			      MSG_DONTWAIT);
	kf_mirror_send(copies, err >= 0);
	if (err < 0)
		return err;
	atomic_long_inc(&kf_sent);
	return len;
}

static ssize_t kf_write(struct file *file, const char __user *buf,
			size_t len, loff_t *ppos)
{
	if (len < NLMSG_HDRLEN || len > KF_MAX_FRAME) {
		atomic_long_inc(&kf_rejected);
		return len < NLMSG_HDRLEN ? -EINVAL : -EMSGSIZE;
	}
	return kf_send(buf, len, true);
}

static bool kf_readable(struct kf_reader *r)
{
	return !skb_queue_empty_lockless(&r->queue);
}

static ssize_t kf_read(struct file *file, char __user *buf, size_t len,
		       loff_t *ppos)
{
	struct kf_reader *r = file->private_data;
	struct sk_buff *skb;
	ssize_t n;
	int err;

	if (!r)
		return -EBADF;
	for (;;) {
		spin_lock_bh(&r->queue.lock);
		skb = skb_peek(&r->queue);
		if (skb && skb->len > len) {
			spin_unlock_bh(&r->queue.lock);
			return -EMSGSIZE;
		}
		if (skb)
			__skb_unlink(skb, &r->queue);
		spin_unlock_bh(&r->queue.lock);
		if (skb)
			break;
		if (file->f_flags & O_NONBLOCK)
			return -EAGAIN;
		err = wait_event_interruptible(r->wait, kf_readable(r));
		if (err)
			return err;
	}
	n = copy_to_user(buf, skb->data, skb->len) ? -EFAULT : skb->len;
	kfree_skb(skb);
	return n;
}

static __poll_t kf_poll(struct file *file, poll_table *wait)
{
	struct kf_reader *r = file->private_data;
	__poll_t mask = EPOLLOUT | EPOLLWRNORM;

	if (r) {
		poll_wait(file, &r->wait, wait);
		if (kf_readable(r))
			mask |= EPOLLIN | EPOLLRDNORM;
	}
	return mask;
}

static int kf_open(struct inode *inode, struct file *file)
{
	struct kf_reader *r;

	file->private_data = NULL;
	if (!(file->f_mode & FMODE_READ))
		return 0;
	r = kzalloc(sizeof(*r), GFP_KERNEL);
	if (!r)
		return -ENOMEM;
	skb_queue_head_init(&r->queue);
	init_waitqueue_head(&r->wait);
	spin_lock_bh(&kf_readers_lock);
	list_add_tail(&r->node, &kf_readers);
	spin_unlock_bh(&kf_readers_lock);
	file->private_data = r;
	return 0;
}

static int kf_release(struct inode *inode, struct file *file)
{
	struct kf_reader *r = file->private_data;

	if (!r)
		return 0;
	spin_lock_bh(&kf_readers_lock);
	list_del(&r->node);
	spin_unlock_bh(&kf_readers_lock);
	/* What the file never read is lost too. */
	atomic_long_add(skb_queue_len(&r->queue), &kf_dropped);
	skb_queue_purge(&r->queue);
	kfree(r);
	return 0;
}

static const struct file_operations kf_fops = {
	.owner = THIS_MODULE,
	.open = kf_open,
	.release = kf_release,
	.read = kf_read,
	.write = kf_write,
	.poll = kf_poll,
	.llseek = no_llseek,
};

static ssize_t kf_inject_write(struct file *file, const char __user *buf,
			       size_t len, loff_t *ppos)
{
	if (len < 1 || len > KF_MAX_FRAME)
		return -EMSGSIZE;
	return kf_send(buf, len, false);
}

static const struct file_operations kf_inject_fops = {
	.owner = THIS_MODULE,
	.open = simple_open,
	.write = kf_inject_write,
	.llseek = no_llseek,
};

#define KF_COUNTER(name)						\
static ssize_t name##_show(struct device *dev,				\
			   struct device_attribute *attr, char *buf)	\
{									\
	return sysfs_emit(buf, "%ld\n", atomic_long_read(&kf_##name));	\
}									\
static DEVICE_ATTR_RO(name)

KF_COUNTER(sent);
KF_COUNTER(received);
KF_COUNTER(malformed);
KF_COUNTER(dropped);
KF_COUNTER(rejected);

static struct attribute *kf_attrs[] = {
	&dev_attr_sent.attr,
	&dev_attr_received.attr,
	&dev_attr_malformed.attr,
	&dev_attr_dropped.attr,
	&dev_attr_rejected.attr,
	NULL,
};
ATTRIBUTE_GROUPS(kf);

static struct miscdevice kf_misc = {
	.minor = MISC_DYNAMIC_MINOR,
	.name = "kestrel_factory",
	.fops = &kf_fops,
	.groups = kf_groups,
	.mode = 0600,
};

static int __init kf_init(void)
{
	struct netlink_kernel_cfg cfg = {
		.input = kf_input,
	};
	int err;

	/*
	 * No module owns the protocol: the daemon's socket must not pin the
	 * module, so that it can be unloaded and loaded again while the daemon
	 * keeps its socket bound. kf_exit makes up for the reference this
	 * gives away.
	 */
	kf_sock = __netlink_kernel_create(&init_net, KF_PROTOCOL, NULL, &cfg);
	if (!kf_sock)
		return -EADDRINUSE;
	err = misc_register(&kf_misc);
	if (err) {
		netlink_kernel_release(kf_sock);
		return err;
	}
	kf_debugfs = debugfs_create_dir("kestrel_factory", NULL);
	debugfs_create_file("inject", 0200, kf_debugfs, NULL, &kf_inject_fops);
	return 0;
}

static void __exit kf_exit(void)
{
	debugfs_remove_recursive(kf_debugfs);
	misc_deregister(&kf_misc);
	/*
	 * Without a module reference behind the protocol, a daemon thread can
	 * still be on its way into kf_input after the release: netlink_unicast
	 * looks the socket up (taking a socket reference inside an RCU read
	 * section), leaves that section and only then calls the socket's
	 * netlink_rcv, dropping the reference after it returns. A counter in
	 * kf_input or synchronize_rcu() alone cannot see a thread between the
	 * lookup and the call. The socket reference can: hold one of our own
	 * across the release and wait until it is the only one left. The
	 * release unhashes the socket, so no new lookup finds it, and drops
	 * its own reference only after an RCU grace period (rcu_barrier()
	 * waits for that drop), by which time every lookup that did find it
	 * holds its reference; so once ours is the last, no thread is in, or
	 * about to enter, this module's text.
	 */
	sock_hold(kf_sock);
	netlink_kernel_release(kf_sock);
	rcu_barrier();
	while (refcount_read(&kf_sock->sk_refcnt) > 1)
		usleep_range(1000, 2000);
	sock_put(kf_sock);
}

module_init(kf_init);
module_exit(kf_exit);
MODULE_LICENSE("GPL");
MODULE_DESCRIPTION("Factory test driver: kernel end of netlink protocol 23");
